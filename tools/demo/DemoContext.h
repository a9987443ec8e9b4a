#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <string>
#include <vector>

#include "Configuration.h"
#include "demo/Checks.h"
#include "demo/DemoApp.h"
#include "demo/ErrorLog.h"
#include "demo/EventLog.h"
#include "demo/KeyValueClient.h"
#include "demo/SourceFiles.h"
#include "demo/Trees.h"

namespace velmora::mobile::xplat::cellar::tools {

class Console;

// Whether its values are inside the manifest.
bool isInline(const StoreDefinition& store);

// What the steps of the demonstration share: the application as it runs now, and what its stores should hold.
class DemoContext {
 public:
  using Definition = std::shared_ptr<const StoreDefinition>;

  // `root` is absolute; `source` and `console` outlive this.
  DemoContext(Console& console, const SourceFiles& source, const std::string& root);
  DemoContext(const DemoContext&) = delete;
  DemoContext& operator=(const DemoContext&) = delete;

  // Ends the run of the application that there is, and starts another without asking for any store.
  void launch(const std::string& release, const std::string& user);

  // The same with all stores opened.
  void start(const std::string& release, const std::string& user);

  // The same, saying how long it took.
  void startTimed(const std::string& release, const std::string& user);

  // Starts the same release for the same user again.
  void restartTimed();

  // The same with `work` done while it is stopped.
  void restartAfter(const std::function<void()>& work);

  void stop();

  bool isRunning() const;

  // Valid while it is running.
  DemoApp& app();

  std::vector<Definition> stores();
  std::vector<Definition> unmanagedStores();
  std::vector<Definition> managedStores();  // those with keys
  Definition definition(const std::string& store);
  bool belongsToSession(const StoreDefinition& store);

  // The store with keys, as the application uses it in this run, and what it should hold.
  KeyValueClient& values(const std::string& store);

  // The same without asking the application for the store, whether it is running or not.
  KeyValueClient& clientOf(const std::string& store);

  // Takes note that nothing is left of a store.
  void expectEmpty(const StoreDefinition& store);

  // The store's directory as it should be, below the root.
  std::string shortDirectory(const StoreDefinition& store);

  // The events of that type that managers have reported so far, oldest first.
  std::vector<JsonValue> storeEvents(const std::string& type) const;

  // Checks that each unmanaged store holds what `contents` says, counted by a walk of our own, and `checkValues`.
  void checkContents();

  // Checks that what came back from each store with keys was right, and that keys and files are those that should be
  // there.
  void checkValues();

  // Checks that the work in the background comes to its end and leaves no trash.
  void checkTrashVanishes();

  // Checks that nobody has logged an error since the last call.
  void checkLog();

  // Keeps the size of each store, and its number of values, where it is the greatest so far.
  void noteSizes();

  Console& console;
  Checks checks;
  const SourceFiles& source;
  const std::string root;
  EventLog events;
  std::map<std::string, TreeSize> contents;      // by store, for the unmanaged ones
  std::map<std::string, TreeSize> fullest;       // by store
  std::map<std::string, std::size_t> mostItems;  // by store, for those with keys
  std::chrono::nanoseconds measuringTime{0};

 private:
  void checkValuesOf(const StoreDefinition& store);

  ErrorLog log_;
  std::map<std::string, KeyValueClient> clients_;  // by store
  std::unique_ptr<DemoApp> app_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
