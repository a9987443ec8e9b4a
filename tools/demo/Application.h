#pragma once

#include <glog/logging.h>

#include <cstddef>
#include <fstream>
#include <map>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <vector>

#include "Configuration.h"
#include "JsonValue.h"
#include "PersistentKeyValueStore.h"
#include "host/Host.h"

namespace velmora::mobile::xplat::cellar::tools {

// The text of examples/media-app.json, the application that the demonstration plays.
extern const std::string kMediaAppConfiguration;

// The application, run after run in one directory. Its events go to "analytics.jsonl" there, and the log of the process
// to "log.txt" in the place of the terminal.
class Application : private google::LogSink {
 public:
  explicit Application(const std::string& root);
  ~Application() override;
  Application(const Application&) = delete;
  Application& operator=(const Application&) = delete;

  // Starts a run, without asking for any store; the one before has been stopped.
  void launch(const std::string& release, const std::string& user);
  void stop() { host_.reset(); }  // nothing is lost

  // The run that there is.
  host::Host& host() { return *host_; }
  const std::string& release() const { return release_; }
  const std::string& user() const { return user_; }
  void openStores();  // all of them
  std::string pathOf(const std::string& store);
  std::shared_ptr<PersistentKeyValueStore> values(const std::string& store);  // a disk cache is one, too

  // Waits until nothing is left to do in the background. Throws `std::runtime_error` after a minute.
  void settle();

  // What is configured: all stores in the order of their managers' names and their own.
  const Configuration& configuration() const { return configuration_; }
  const StoreDefinition& definition(const std::string& store) const { return *configuration_.getStore(store); }
  const std::vector<std::shared_ptr<const StoreDefinition>>& stores() const { return stores_; }
  const std::set<std::string>& unmanagedStores() const { return unmanaged_; }
  const std::set<std::string>& storesWithKeys() const { return withKeys_; }

  // The payloads of the events of all runs by name, oldest first, as the sink has written them.
  std::map<std::string, std::vector<JsonValue>> events() const;

  // The lines of errors in the log since the last call.
  std::vector<std::string> takeErrors();

 private:
  using google::LogSink::send;
  void send(google::LogSeverity severity, const char* path, const char* file, int line,
            const google::LogMessageTime& time, const char* message, std::size_t length) override;

  const std::string root_;
  const std::string events_;  // the path of their file
  const Configuration configuration_;
  std::vector<std::shared_ptr<const StoreDefinition>> stores_;
  std::set<std::string> unmanaged_;
  std::set<std::string> withKeys_;
  std::string release_;
  std::string user_;
  std::unique_ptr<host::Host> host_;

  std::mutex mutex_;  // guards the two below
  std::vector<std::string> errors_;
  std::ofstream log_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
