#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "DiskCache.h"
#include "PersistentKeyValueStore.h"
#include "host/Await.h"
#include "host/Host.h"
#include "host/ThreadQueueFactory.h"
#include "host/testing/CheckedQueues.h"
#include "support/Barrier.h"
#include "support/BrokenQueues.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

using testing::Contains;
using testing::ContainsRegex;
using testing::IsEmpty;

constexpr std::chrono::hours kLongPatience(1);

const char* const kConfiguration = R"({
  "media": {"stores": {
    "covers": {"type": "disk_cache", "lru_size_limit": "1MB", "prune_strategy": "lru"},
    "letters": {"type": "pkvs"}
  }}
})";

host::HostOptions optionsFor(const TemporaryDirectory& directory, const std::shared_ptr<TaskQueueFactory>& queues) {
  host::HostOptions options;
  options.configuration = kConfiguration;
  options.root = directory.path();
  options.taskQueueFactory = queues;
  options.lazyDelaySeconds = 0;
  return options;
}

template <class StoreType> void useStore(host::Host& host, const std::string& name) {
  const auto store = host.store<StoreType>(name, "alice");
  std::vector<Future<void>> stored;
  for (int i = 0; i < 20; ++i) stored.push_back(store->store("key" + std::to_string(i), {'v'}));
  for (const Future<void>& each : stored) host::await(each);
  const auto found = host::await(store->fetch("key7"));
  ASSERT_NE(found, nullptr);
  EXPECT_EQ(found->value, (std::vector<unsigned char>{'v'}));
  host::await(store->removeItem("key7"));
  EXPECT_EQ(host::await(store->fetch("key7")), nullptr);
}

TEST(CheckedHost, AHostOnThreadsOfTheKitBreaksNoRule) {
  const TemporaryDirectory directory;
  const auto threads = std::make_shared<host::ThreadQueueFactory>();
  const auto checked = std::make_shared<CheckedQueues>(threads);
  {
    host::Host host(optionsFor(directory, checked));
    useStore<DiskCache>(host, "covers");
    useStore<PersistentKeyValueStore>(host, "letters");
    host.logOut();
    EXPECT_THAT(host.sessions(), IsEmpty());
  }
  EXPECT_TRUE(threads->drain(kLongPatience));
  EXPECT_THAT(checked->violations(), IsEmpty());
}

// A serial queue whose tasks go to another thread from the switch on, whether or not the first one still runs a task.
class SwitchingQueue : public PassingQueue {
 public:
  explicit SwitchingQueue(TaskQueueFactory& kit) : PassingQueue(kit), other_(kit.createQueue()) {}

  static std::atomic<bool>& isSwitched() {
    static std::atomic<bool> ofAll{false};
    return ofAll;
  }

  void dispatch(Task task) override { (isSwitched() ? other_ : queue)->dispatch(std::move(task)); }

 private:
  const std::shared_ptr<AsyncExecutor> other_;
};

// The first fetch is in the midst of its loader, on a queue of the store, while the second one runs on another thread.
TEST(CheckedHost, APoolThatIsNotSerialIsReported) {
  const TemporaryDirectory directory;
  const auto checked = std::make_shared<CheckedQueues>(std::make_shared<FactoryOf<SwitchingQueue>>());
  SwitchingQueue::isSwitched() = false;
  host::HostOptions options = optionsFor(directory, checked);
  options.lazyDelaySeconds = 3600;  // nothing but the fetches runs meanwhile
  options.runMaintenance = false;
  host::Host host(std::move(options));
  const auto letters = host.store<PersistentKeyValueStore>("letters", "alice");
  host::await(letters->store("key", {'v'}));
  EXPECT_THAT(checked->violations(), IsEmpty());

  Latch begun(1);
  Latch end(1);
  const PersistentKeyValueStore::Loader loader = [&](auto&&...) {
    begun.countDown();
    end.wait();
    return true;
  };
  const auto first = letters->fetch("key", loader);
  begun.wait();
  SwitchingQueue::isSwitched() = true;
  EXPECT_NE(host::await(letters->fetch("key")), nullptr);
  EXPECT_THAT(checked->violations(),
              Contains(ContainsRegex("(File|Work) queue [0-9]+: task [0-9]+ began before task [0-9]+ had ended, on "
                                     "another thread. Tasks of a queue run one at a time.")));
  end.countDown();
  EXPECT_NE(host::await(first), nullptr);
  host.logOut();
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
