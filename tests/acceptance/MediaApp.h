#pragma once

#include <gtest/gtest.h>

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "PersistentKeyValueStore.h"
#include "host/Host.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"
#include "host/testing/RecordingAnalytics.h"
#include "support/LogCapture.h"
#include "support/ManagerServices.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::acceptance {

using Bytes = std::vector<unsigned char>;

// What one store with keys should hold, and in which order it lets go of it.
class ModelOfValues {
 public:
  struct Item {
    Bytes value;
    std::int64_t stored;  // dates in seconds since the Unix epoch
    std::int64_t used;
    std::optional<int> second;  // of the video that it is a chunk of
  };

  // Values from which on a new one takes the place of the one used least recently; empty for no limit.
  std::optional<std::size_t> capacity;

  // The early chunks of videos count as if they had been used so many seconds later.
  std::int64_t grace = 0;

  void put(const std::string& key, const Item& item);

  // Takes out what goes until `limit` bytes are left; its keys in that order.
  std::vector<std::string> prune(std::size_t limit);

  // Takes out what was last used before that date.
  void expire(std::int64_t date);

  std::size_t bytes() const;
  std::vector<std::string> keys() const;

  std::map<std::string, Item> items;

 private:
  std::string firstToGo() const;
};

// The application of examples/media-app.json on the host kit, with its limits in kilobytes instead of megabytes. Its
// queues, timers, disk size and clock are the test's; it runs for one user in one release at a time. Beside it a model
// of every store, against which everything on disk and everything that is fetched is held.
class MediaApp : public testing::Test {
 protected:
  static constexpr std::size_t kKilobyte = 1024;
  static constexpr long kDay = 86400;

  MediaApp();
  ~MediaApp() override;

  // --- Its life ---

  // Starts it and opens every store, as an application does.
  void start();
  void launch();            // the first half of that
  void openStores() const;  // and the second
  void stop();
  void restart();

  // Runs all that is queued.
  void settle() const;

  // Fires the timers of that delay, on each queue once, and runs what they set off.
  void fireTimers(long seconds) const;

  // Runs the queues while `operation`, which waits for them, is under way on another thread.
  void runBeside(const std::function<void()>& operation) const;

  // Every step takes its time: no two dates are equal.
  void tick();

  // --- Its stores ---

  std::shared_ptr<PersistentKeyValueStore> open(const std::string& store) const;
  std::shared_ptr<StoreManager> managerOf(const std::string& store) const;

  // Where its directory has to be, below the root.
  std::string directoryOf(const std::string& store) const;
  std::string pathOf(const std::string& store) const;

  std::vector<std::string> unmanagedStores() const;
  std::vector<std::string> keyedStores() const;  // those with keys

  // --- What it does, and the model with it ---

  // Puts a file into an unmanaged store, past the library.
  void write(const std::string& store, const std::string& name, std::size_t bytes);

  // A few files in every unmanaged store, and a few values in every other.
  void fillEverything();

  void put(const std::string& store, const std::string& key, std::size_t bytes,
           std::optional<int> second = std::nullopt);
  void remove(const std::string& store, const std::string& key);

  // Fetches the key and holds what comes back against the model.
  void expectFetched(const std::string& store, const std::string& key);

  // Nothing is left of the store, or of all stores whose directories begin like that.
  void forget(const std::string& store);
  void forgetBelow(const std::string& beginning);

  // --- What is there ---

  // Every store holds what the model says, in its directory and for its users; there is no trash, and no error in the
  // log.
  void expectAsModelled();

  // Each value comes back as it was stored.
  void expectAllFetched();

  // The records in the manifests are those of the model to the last date. To be called while it is stopped.
  void expectRowsAsModelled() const;

  // Changes the date of last use in the manifest of the stopped application.
  void backdate(const std::string& store, const std::string& key, std::int64_t date);

  // The managers' events of that type, each as "store size limit".
  std::vector<std::string> managerEvents(const std::string& type) const;

  // The names of the files of a store that were deleted in this run, in that order.
  std::vector<std::string> deletedFilesOf(const std::string& store) const;

  bool exists(const std::string& below) const { return directory_.exists(below); }

  std::string release_ = "100";
  std::string user_ = "alice";
  std::map<std::string, ModelOfValues> values_;                        // by store
  std::map<std::string, std::map<std::string, std::string>> written_;  // by store and name: the unmanaged ones
  std::size_t hits_ = 0;
  std::size_t misses_ = 0;

  test::TemporaryDirectory directory_;
  std::int64_t now_ = 1'700'000'000;
  test::ManualClock clock_{now_};
  test::LogCapture log_;
  std::shared_ptr<test::EventLog> events_ = std::make_shared<test::EventLog>();
  std::shared_ptr<test::DiskOfChosenSize> files_;
  std::shared_ptr<test::ManualQueueFactory> queues_;
  std::unique_ptr<host::Host> host_;

 private:
  void expectKeysAndFiles(const std::string& store) const;
};

}  // namespace velmora::mobile::xplat::cellar::acceptance
