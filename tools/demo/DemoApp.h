#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "Configuration.h"
#include "FileUtils.h"
#include "PersistentKeyValueStore.h"
#include "Store.h"
#include "host/Host.h"

namespace velmora::mobile::xplat::cellar::tools {

class ClockedQueues;
class EventLog;

// The file system, with a note taken of the listings of directories and of the deletions of files.
class WatchedFiles : public FileUtils {
 public:
  std::vector<Info> listDirectory(const std::string& path) override;
  void deleteFile(const std::string& path) override;

  std::uint64_t listings() const;

  // The files deleted so far, in that order.
  std::vector<std::string> deletions() const;

 private:
  std::atomic<std::uint64_t> listings_{0};
  mutable std::mutex mutex_;  // guards the deletions
  std::vector<std::string> deletions_;
};

// One run of the media application, from its start to its end: which release of it, and who uses it. Destroying it is
// leaving the application: nothing is lost.
class DemoApp {
 public:
  DemoApp(const std::string& root, const std::string& release, const std::string& user, EventLog& events);
  ~DemoApp();
  DemoApp(const DemoApp&) = delete;
  DemoApp& operator=(const DemoApp&) = delete;

  // All stores of the configuration with that type, in the order of manager and identifier.
  std::vector<std::shared_ptr<const StoreDefinition>> storeDefinitions() const;

  // Asks for every store, as an application does at its start.
  void openStores();

  std::shared_ptr<StoreManager> managerOf(const StoreDefinition& store);
  std::shared_ptr<UnmanagedStore> unmanagedStore(const std::string& identifier);

  std::shared_ptr<PersistentKeyValueStore> keyValueStore(const std::string& identifier);  // a disk cache is one too

  // Where that store's directory has to be, worked out here and not asked of the library.
  std::string expectedDirectory(const StoreDefinition& store) const;

  // The same for its manager.
  std::string expectedManagerDirectory(const StoreDefinition& store) const;

  // The directory of the trash.
  std::string trashDirectory() const;

  // Waits until nothing is left to do in the background; false when that takes too long.
  bool settle();

  // Lets that time pass for the timers of the application, and waits until what they set off is done; false when that
  // takes too long. Dates are not changed by it.
  bool letPass(std::chrono::seconds time);

  // What it has done to the file system so far in this run.
  const WatchedFiles& files() const;

  host::Host& host();
  std::string release() const;
  std::string user() const;

 private:
  const std::string root_;
  const std::string release_;
  const std::string user_;
  const std::shared_ptr<WatchedFiles> files_;
  const std::shared_ptr<ClockedQueues> queues_;
  std::unique_ptr<host::Host> host_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
