#include "host/Expiring.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <future>
#include <limits>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "host/Await.h"
#include "host/ThreadQueueFactory.h"
#include "support/Barrier.h"
#include "support/KeyValueStoreFixture.h"
#include "support/LogCapture.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using std::string;
using std::chrono::seconds;
using test::Bytes;
using test::ManualExecutor;

// What has become of a `get`: "<pending>", "<miss>", "<error>" with its text, or the value.
std::shared_ptr<string> watch(Future<std::optional<string>> future) {
  auto told = std::make_shared<string>("<pending>");
  future.then(nullptr, [told](std::future<std::optional<string>>& result) {
    try {
      *told = result.get().value_or("<miss>");
    } catch (const std::exception& error) {
      *told = string("<error> ") + error.what();
    }
  });
  return told;
}

class ExpiringTest : public test::KeyValueStoreFixture {
 public:
  ExpiringTest() { open(); }

  ExpiringStore<string> tokens() const { return ExpiringStore<string>(store); }

  void put(const string& key, const string& value, seconds timeToLive) const {
    const test::Written written = test::watch(tokens().put(key, value, timeToLive));
    settle();
    ASSERT_EQ(told(written), "<done>");
  }

  string get(const string& key) const {
    const auto value = watch(tokens().get(key));
    settle();
    return *value;
  }

  bool isStored(const string& key) const {
    const std::vector<string> keys = tokens().keys();
    return std::find(keys.begin(), keys.end(), key) != keys.end();
  }
};

TEST_F(ExpiringTest, KeepsAValueUntilItsTimeHasPassed) {
  put("a", "1", seconds(10));
  EXPECT_EQ(get("a"), "1");
  clock.set(kStart + 9);
  EXPECT_EQ(get("a"), "1");
  EXPECT_TRUE(isStored("a"));
  clock.set(kStart + 10);
  EXPECT_EQ(get("a"), "<miss>");
  EXPECT_EQ(get("a"), "<miss>");
}

TEST_F(ExpiringTest, RemovesAnExpiredValueThatIsAskedFor) {
  put("a", "1", seconds(10));
  put("b", "2", seconds(10));
  clock.advance(10);
  EXPECT_TRUE(isStored("a"));
  EXPECT_EQ(get("a"), "<miss>");
  EXPECT_FALSE(isStored("a"));
  EXPECT_TRUE(isStored("b"));
}

TEST_F(ExpiringTest, GivesEachValueItsOwnTime) {
  put("short", "1", seconds(1));
  put("long", "2", std::chrono::hours(1));
  clock.advance(3599);
  EXPECT_EQ(get("short"), "<miss>");
  EXPECT_EQ(get("long"), "2");
  clock.advance(1);
  EXPECT_EQ(get("long"), "<miss>");
}

TEST_F(ExpiringTest, StartsAgainWithEachPut) {
  put("a", "1", seconds(10));
  clock.advance(9);
  put("a", "2", seconds(10));
  clock.advance(9);
  EXPECT_EQ(get("a"), "2");
  clock.advance(1);
  EXPECT_EQ(get("a"), "<miss>");
}

TEST_F(ExpiringTest, TreatsNoTimeAsExpiredWhateverTheClockSaysLater) {
  put("a", "1", seconds(10));
  put("a", "2", seconds(0));
  put("b", "2", seconds(-1));
  put("c", "2", seconds::min());
  clock.set(0);
  for (const string key : {"a", "b", "c"}) {
    EXPECT_TRUE(isStored(key));
    EXPECT_EQ(get(key), "<miss>") << key;
    EXPECT_FALSE(isStored(key));
  }
}

TEST_F(ExpiringTest, KeepsForEverWhatHasAllTheTime) {
  put("a", "1", seconds::max());
  put("b", "2", seconds::max() - seconds(kStart));
  clock.set(std::numeric_limits<std::int64_t>::max() - 1);
  EXPECT_EQ(get("a"), "1");
  EXPECT_EQ(get("b"), "2");
}

TEST_F(ExpiringTest, SurvivesARestart) {
  put("a", "1", seconds(10));
  reopen();
  clock.advance(9);
  EXPECT_EQ(get("a"), "1");
  clock.advance(1);
  EXPECT_EQ(get("a"), "<miss>");
}

TEST_F(ExpiringTest, TakesTextsAsTheyCome) {
  const std::string_view view("view");
  tokens().put("a", "literal", seconds(1));
  tokens().put("b", view, seconds(1));
  tokens().put("c", string(view), std::chrono::minutes(1));
  EXPECT_EQ(get("a"), "literal");
  EXPECT_EQ(get("b"), "view");
  EXPECT_EQ(get("c"), "view");
}

TEST_F(ExpiringTest, TakesACodecWithAState) {
  struct Shift {
    unsigned char by;
    Bytes encode(const int& value) const { return {static_cast<unsigned char>(value + by)}; }
    int decode(const Bytes& bytes) const { return bytes.at(0) - by; }
  };
  const ExpiringStore<int, Shift> values(store, Expiring<Shift>(Shift{3}));
  values.put("a", 4, seconds(10));
  auto value = values.get("a");
  settle();
  EXPECT_EQ(await(value), 4);
}

// --- The format ---

TEST_F(ExpiringTest, WritesTheDateBeforeTheBytes) {
  const Bytes header = {0xce, 'E', 'x', 1, 0x4a, 0x42, 0x0f, 0, 0, 0, 0, 0};  // 1'000'010
  Bytes expected = header;
  expected.push_back('v');
  EXPECT_EQ(Expiring<StringCodec>().encode("v", seconds(10)), expected);
}

TEST_F(ExpiringTest, RefusesBytesOfAnotherCodec) {
  const string beginning = "<error> The value of 'a' in store 'store' cannot be decoded: ";
  const Bytes good = Expiring<StringCodec>().encode("", seconds(10));
  const auto getting = [this](const Bytes& bytes) {
    store->store("a", bytes);
    return get("a");
  };
  EXPECT_EQ(getting(good), "");
  EXPECT_EQ(getting(Bytes(good.begin(), good.end() - 1)), beginning + "It does not have a time to live.");
  EXPECT_EQ(getting({}), beginning + "It does not have a time to live.");
  for (const std::size_t i : {0U, 1U, 2U}) {
    Bytes other = good;
    ++other[i];
    EXPECT_EQ(getting(other), beginning + "It does not have a time to live.") << i;
  }
  Bytes newer = good;
  newer[3] = 2;
  EXPECT_EQ(getting(newer), beginning + "Its time to live has the unknown format 2.");
  EXPECT_TRUE(isStored("a")) << "what is not understood is not removed";
}

TEST_F(ExpiringTest, NamesTheReasonOfTheOtherCodec) {
  store->store("a", Expiring<StringCodec>().encode("abc", seconds(10)));
  const ExpiringStore<std::int32_t> numbers(store);
  auto value = numbers.get("a");
  settle();
  try {
    static_cast<void>(await(value));
    FAIL() << "It has three bytes.";
  } catch (const DecodeError& error) {
    EXPECT_STREQ(error.what(), "The value of 'a' in store 'store' cannot be decoded: 3 bytes instead of 4.");
  }
}

TEST_F(ExpiringTest, DoesNotDecodeWhatHasExpired) {
  store->store("a", Expiring<StringCodec>().encode("abc", seconds(0)));
  auto value = ExpiringStore<std::int32_t>(store).get("a");
  settle();
  EXPECT_EQ(await(value), std::nullopt);
}

// --- Removing nothing newer ---

TEST_F(ExpiringTest, LeavesAValueThatWasPutWhileTheOldOneWasRead) {
  put("a", "old", seconds(10));
  clock.advance(10);
  const auto value = watch(tokens().get("a"));
  tokens().put("a", "new", seconds(10));  // through another handle
  settle();
  EXPECT_EQ(*value, "<miss>");
  EXPECT_EQ(get("a"), "new");
}

TEST_F(ExpiringTest, LeavesAValueThatWasPutBeforeTheOldOneWasDecoded) {
  put("a", "old", seconds(10));
  clock.advance(10);
  const auto queue = std::make_shared<ManualExecutor>();
  const auto value = watch(ExpiringStore<string>(store, {}, queue).get("a"));
  settle();
  put("a", "new", seconds(10));
  EXPECT_EQ(queue->runAll(), 1U);
  settle();
  EXPECT_EQ(*value, "<miss>");
  EXPECT_EQ(get("a"), "new");
}

TEST_F(ExpiringTest, RemovesBeforeAnyPutThatAnswersTheMiss) {
  put("a", "old", seconds(10));
  clock.advance(10);
  const auto values = tokens();
  values.get("a").then(nullptr, [&](std::future<std::optional<string>>& value) {
    if (!value.get()) values.put("a", "computed", seconds(10));
  });
  settle();
  EXPECT_EQ(get("a"), "computed");
}

TEST_F(ExpiringTest, IsNotKeptFromRemovingByPutsOfOtherKeys) {
  put("a", "old", seconds(10));
  clock.advance(10);
  const auto value = watch(tokens().get("a"));
  for (int i = 0; i < 50; ++i) tokens().put("other " + std::to_string(i), "x", seconds(10));
  settle();
  EXPECT_EQ(*value, "<miss>");
  EXPECT_FALSE(isStored("a"));
}

TEST_F(ExpiringTest, RemovesOnceForManyThatAsk) {
  put("a", "old", seconds(10));
  clock.advance(10);
  const auto first = watch(tokens().get("a"));
  const auto second = watch(tokens().get("a"));
  settle();
  EXPECT_EQ(*first + *second, "<miss><miss>");
  put("a", "new", seconds(10));
  EXPECT_EQ(get("a"), "new");
}

TEST_F(ExpiringTest, WorksOnQueuesThatRunTasksAtOnce) {
  put("a", "old", seconds(10));
  clock.advance(10);
  for (const auto& queue : queues->all()) queue->onDispatch = [queue = queue.get()] { queue->runAll(); };
  EXPECT_EQ(*watch(tokens().get("a")), "<miss>");
  EXPECT_FALSE(isStored("a"));
  tokens().put("a", "new", seconds(10));
  EXPECT_EQ(*watch(tokens().get("a")), "new");
  for (const auto& queue : queues->all()) queue->onDispatch = nullptr;
}

TEST_F(ExpiringTest, IsAMissAlsoWhenTheRemovalFailsWhichIsOneErrorLine) {
  put("My Key", "old", seconds(10));
  clock.advance(10);
  files->failNext(test::Operation::DeleteFile, EIO);
  const test::LogCapture log;
  EXPECT_EQ(get("My Key"), "<miss>");
  EXPECT_EQ(log.errorCount(), 1U);
  EXPECT_TRUE(
      log.contains("An expired value is not removed: Store 'store', key 'My Key', " + store->path + ": domain"));
}

TEST_F(ExpiringTest, IsAMissAlsoWhenTheRemovalIsRefusedWhichIsOneErrorLine) {
  put("a", "old", seconds(10));
  clock.advance(10);
  const auto queue = std::make_shared<ManualExecutor>();
  const auto value = watch(ExpiringStore<string>(store, {}, queue).get("a"));
  settle();
  work().throwOnDispatch(true);
  const test::LogCapture log;
  EXPECT_EQ(queue->runAll(), 1U);
  settle();
  EXPECT_EQ(*value, "<miss>");
  EXPECT_EQ(log.errorCount(), 1U);
  EXPECT_TRUE(log.contains("An expired value is not removed: Store 'store', key 'a', "));
}

TEST_F(ExpiringTest, ARemovalThatSucceedsLogsNothing) {
  put("a", "old", seconds(10));
  clock.advance(10);
  const test::LogCapture log;
  EXPECT_EQ(get("a"), "<miss>");
  EXPECT_EQ(log.errorCount(), 0U);
}

TEST_F(ExpiringTest, AStoreThatIsInvalidOrDroppedBeforeTheRemovalLogsNothing) {
  const test::LogCapture log;
  for (const bool isInvalid : {false, true}) {
    put("a", "old", seconds(0));
    const auto queue = std::make_shared<ManualExecutor>();
    const auto value = watch(ExpiringStore<string>(store, {}, queue).get("a"));
    settle();
    if (isInvalid) store->invalidateSoon();
    EXPECT_EQ(queue->runAll(), 1U);
    if (!isInvalid) work().dropAll();
    settle();
    EXPECT_EQ(*value, "<miss>");
  }
  EXPECT_EQ(log.errorCount(), 0U);
}

TEST_F(ExpiringTest, IsAMissAlsoWhenTheStoreIsGoneByThen) {
  put("a", "old", seconds(10));
  clock.advance(10);
  const auto queue = std::make_shared<ManualExecutor>();
  auto value = std::make_unique<ExpiringStore<string>>(store, Expiring<DefaultCodec<string>>(), queue);
  const auto outcome = watch(value->get("a"));
  value.reset();
  settle();
  store.reset();
  queue->runAll();
  EXPECT_EQ(*outcome, "<miss>");
}

// Readers that find an expired value, and writers that replace it, at the same time: what was put last stays.
TEST(ExpiringThreads, NeverLoseANewerValue) {
  const test::TemporaryDirectory directory;
  const auto queues = std::make_shared<ThreadQueueFactory>();
  const auto files = std::make_shared<FileUtils>();
  const StoreServices services{
      queues, std::make_shared<TrashCollector>(directory.file("trash"), files, nullptr, queues), files, nullptr};
  KeyValueStoreOptions options;
  options.directory = directory.file("store");
  options.temporaryDirectory = directory.file("temporary");
  options.name = "threads";
  options.inlineData = true;
  const ExpiringStore<int> values(PersistentKeyValueStore::create(options, services));
  for (int round = 0; round < 50; ++round) {
    await(values.put("a", -1, seconds(0)));
    test::runOnThreads(3, [&](std::size_t thread) {
      if (thread == 0) {
        await(values.put("a", round, seconds::max()));
      } else {
        EXPECT_NE(await(values.get("a")), -1);
      }
    });
    EXPECT_EQ(await(values.get("a")), round);
  }
  queues->drain(std::chrono::hours(1));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
