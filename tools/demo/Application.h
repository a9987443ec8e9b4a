#pragma once

#include <memory>
#include <string>
#include <vector>

#include "Configuration.h"
#include "JsonValue.h"
#include "PersistentKeyValueStore.h"
#include "Store.h"
#include "host/Host.h"

namespace velmora::mobile::xplat::cellar::tools {

// The text of examples/media-app.json, the application that the demonstration plays.
extern const std::string kMediaAppConfiguration;

// The application, run after run in one directory. Its log goes to "log.txt" there, and its events to
// "analytics.jsonl".
class Application {
 public:
  explicit Application(const std::string& root);
  ~Application();
  Application(const Application&) = delete;
  Application& operator=(const Application&) = delete;

  // Ends the run that there is and starts another, without asking for any store.
  void launch(const std::string& release, const std::string& user);

  // Asks for every store.
  void openStores();

  // Ends the run. Nothing is lost.
  void stop();

  // --- While it is running ---

  host::Host& host() { return *host_; }
  const std::string& release() const { return release_; }
  const std::string& user() const { return user_; }

  // All stores of the configuration, in the order of their managers' names and their own.
  const std::vector<std::shared_ptr<const StoreDefinition>>& stores() const { return stores_; }
  const StoreDefinition& definition(const std::string& store) const;
  bool belongsToSession(const StoreDefinition& store) const;

  std::string pathOf(const std::string& store);
  std::shared_ptr<PersistentKeyValueStore> values(const std::string& store);  // a disk cache is one, too

  // Waits until nothing is left to do in the background; false when that takes longer than a minute.
  bool settle();

  // --- What it has said so far ---

  // The events of all runs, as the sink has written them.
  std::vector<JsonValue> events() const;

  // The lines of errors in the log since the last call.
  std::vector<std::string> takeErrors();

 private:
  class Log;

  const std::string root_;
  const std::string events_;  // the path of their file
  const std::unique_ptr<Log> log_;
  std::string release_;
  std::string user_;
  std::vector<std::shared_ptr<const StoreDefinition>> stores_;
  std::unique_ptr<host::Host> host_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
