// Writes that are on their way while other operations on their keys come in between: in every order in which two queues
// can run them, what is left is what the operations say, one after the other.

#include "keyvalue/WritesInFlight.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "DiskCache.h"
#include "DiskCacheManifest.h"
#include "FileUtils.h"
#include "LarderException.h"
#include "TrashCollector.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::bytesOf;
using test::Contents;
using test::Fetched;
using test::isA;
using test::KeyValueStoreFixture;
using test::ManualClock;
using test::ManualQueueFactory;
using test::MemoryMedium;
using test::MemoryPersistence;
using test::textOf;
using test::told;
using test::watch;
using test::Written;
using testing::ElementsAre;
using testing::IsEmpty;

// --- The bookkeeping ---

using State = WritesInFlight::State;
using Write = WritesInFlight::Write;

TEST(WritesInFlight, KnowsAWriteFromItsBeginningToItsEnd) {
  WritesInFlight writes;
  Write write("key");
  EXPECT_EQ(write.state, State::New);
  EXPECT_FALSE(writes.contains("key"));
  writes.begin(write, {});
  EXPECT_EQ(write.state, State::Queued);
  EXPECT_TRUE(writes.contains("key"));
  EXPECT_FALSE(writes.contains("other"));
  writes.end(write);
  EXPECT_EQ(write.state, State::Done);
  EXPECT_FALSE(writes.contains("key"));
  EXPECT_THAT(writes.keys(), IsEmpty());
}

TEST(WritesInFlight, EndsOneOfSeveralOfAKeyAndNoneTwice) {
  WritesInFlight writes;
  Write first("key");
  Write second("key");
  writes.begin(first, {});
  writes.begin(second, {});
  EXPECT_TRUE(writes.end(first));
  EXPECT_FALSE(writes.end(first));
  EXPECT_EQ(first.state, State::Done);
  EXPECT_THAT(writes.keys(), ElementsAre("key"));
  EXPECT_EQ(second.state, State::Queued);
  EXPECT_TRUE(writes.contains("key"));
}

TEST(WritesInFlight, RevokesAllOfAKeyAndNoOther) {
  WritesInFlight writes;
  Write first("key");
  Write second("key");
  Write other("other");
  for (Write* write : {&first, &second, &other}) writes.begin(*write, {});
  EXPECT_TRUE(writes.revoke("key"));
  EXPECT_EQ(first.state, State::Revoked);
  EXPECT_EQ(second.state, State::Revoked);
  EXPECT_EQ(other.state, State::Queued);
  EXPECT_FALSE(writes.revoke("unknown"));
}

TEST(WritesInFlight, AreClaimedOnceAndWrittenUnlessTheyAreRevoked) {
  WritesInFlight writes;
  Write write("key");
  Write revoked("revoked");
  writes.begin(write, {});
  writes.begin(revoked, {});
  writes.revoke("revoked");
  EXPECT_FALSE(write.isClaimed());
  EXPECT_FALSE(revoked.isClaimed());
  EXPECT_TRUE(writes.claim(write));
  EXPECT_EQ(write.state, State::Writing);
  EXPECT_TRUE(write.isClaimed());
  EXPECT_FALSE(writes.claim(write));
  EXPECT_TRUE(writes.claim(revoked));
  EXPECT_EQ(revoked.state, State::Discarded);
  EXPECT_FALSE(writes.claim(revoked));
}

TEST(WritesInFlight, ThatAreRevokedUnderTheirWriterAreDiscarded) {
  WritesInFlight writes;
  Write write("key");
  writes.begin(write, {});
  writes.claim(write);
  EXPECT_TRUE(writes.revoke("key"));
  EXPECT_EQ(write.state, State::Discarded);
}

TEST(WritesInFlight, ThatHaveNotBegunAreTheClaimersOwn) {
  WritesInFlight writes;
  Write write("key");
  EXPECT_TRUE(writes.claim(write));
  EXPECT_EQ(write.state, State::New);
}

TEST(WritesInFlight, ThatLoseTheirRecordsAreDiscardedIfTheyRunAndGoOnWithoutOtherwise) {
  WritesInFlight writes;
  Write running("running");
  Write waiting("waiting");
  writes.begin(running, {});
  writes.begin(waiting, {});
  writes.claim(running);
  EXPECT_TRUE(waiting.hasRecord);
  writes.detachRecords(writes.holdClaims());
  EXPECT_EQ(running.state, State::Discarded);
  EXPECT_EQ(waiting.state, State::Queued);
  EXPECT_FALSE(waiting.hasRecord);
}

// --- In one breath ---

class PersistentKeyValueStoreInOneBreath : public KeyValueStoreFixture {
 protected:
  Written putting(const std::string& key, const std::string& value) const {
    return watch(store->store(key, bytesOf(value)));
  }

  // A write that leaves `half` in its file and fails.
  Written failing(const std::string& key, const std::optional<std::string>& half) const {
    return watch(store->store(key, nullptr, [files = files, half](const std::string& path) -> unsigned int {
      if (half) files->writeFile(path, bytesOf(*half));
      throw std::runtime_error("The writer gave up.");
    }));
  }

  // All of the work first, then the files.
  void settleWorkFirst() const {
    work().runAll();
    settle();
  }

  void expectNothingOf(const std::string& key) {
    EXPECT_EQ(get(key), "<miss>");
    EXPECT_FALSE(directory.exists("store/" + key));
    EXPECT_THAT(rowsOnDisk(), IsEmpty());
    reopen();
    EXPECT_EQ(get(key), "<miss>");
  }
};

TEST_F(PersistentKeyValueStoreInOneBreath, StoredAndRemovedIsGone) {
  open();
  const Written written = putting("key", "value");
  const Written removed = watch(store->removeItem("key"));
  settleWorkFirst();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(told(removed), "<done>");
  expectNothingOf("key");
}

TEST_F(PersistentKeyValueStoreInOneBreath, RemovedAndStoredIsThere) {
  open();
  put("key", "old");
  const Written removed = watch(store->removeItem("key"));
  putting("key", "new");
  settleWorkFirst();
  EXPECT_EQ(told(removed), "<done>");
  EXPECT_EQ(get("key"), "new");
}

TEST_F(PersistentKeyValueStoreInOneBreath, StoredRemovedAndStoredHoldsTheLastValue) {
  open();
  putting("key", "first");
  const Written removed = watch(store->removeItem("key"));
  const Written last = putting("key", "last");
  settleWorkFirst();
  EXPECT_EQ(told(removed), "<done>");
  EXPECT_EQ(told(last), "<done>");
  EXPECT_EQ(contents(), (Contents{{"key", "last"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("key"));
  reopen();
  EXPECT_EQ(contents(), (Contents{{"key", "last"}}));
}

TEST_F(PersistentKeyValueStoreInOneBreath, TheRemovalOfAWriteOnItsWayIsDoneWhenItsFileIsGone) {
  open();
  put("key", "old");
  putting("key", "new");
  const Written removed = watch(store->removeItem("key"));
  work().runAll();
  EXPECT_TRUE(removed->isPending());
  EXPECT_TRUE(file().runNext());
  EXPECT_THAT(valueFiles(), IsEmpty());
  EXPECT_TRUE(removed->isPending());
  EXPECT_TRUE(file().runNext());
  EXPECT_EQ(told(removed), "<done>");
}

TEST_F(PersistentKeyValueStoreInOneBreath, ARevokedWriteNeverCallsItsWriter) {
  open();
  bool called = false;
  const Written written = watch(store->store("key", nullptr, [&](const std::string&) {
    called = true;
    return 1U;
  }));
  watch(store->removeItem("key"));
  settleWorkFirst();
  EXPECT_FALSE(called);
  EXPECT_EQ(told(written), "<done>");
}

TEST_F(PersistentKeyValueStoreInOneBreath, TwoWritesOfAKeyLeaveTheLater) {
  open();
  const Written first = putting("key", "first");
  const Written second = putting("key", "second");
  settleWorkFirst();
  EXPECT_EQ(told(first), "<done>");
  EXPECT_EQ(told(second), "<done>");
  EXPECT_EQ(get("key"), "second");
  EXPECT_THAT(rowsOnDisk(), ElementsAre("key key 6 0 1000000 1000000 -"));
}

TEST_F(PersistentKeyValueStoreInOneBreath, AFetchBetweenTwoWritesGivesTheValueBetween) {
  open();
  putting("key", "first");
  const Fetched between = watch(store->fetch("key"));
  putting("key", "second");
  settleWorkFirst();
  EXPECT_EQ(told(between), "first");
  EXPECT_EQ(get("key"), "second");
}

TEST_F(PersistentKeyValueStoreInOneBreath, RemovedByTheRunningWriterItselfIsGone) {
  open();
  Written removed;
  const Written written = watch(store->store("key", nullptr, [&](const std::string& path) {
    files->writeFile(path, bytesOf("half"));
    removed = watch(store->removeItem("key"));
    work().runAll();
    files->writeFile(path, bytesOf("whole"));
    return 5U;
  }));
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(told(removed), "<done>");
  expectNothingOf("key");
}

TEST_F(PersistentKeyValueStoreInOneBreath, ClearedByTheRunningWriterItselfIsGone) {
  open();
  put("other", "value");
  const Written written = watch(store->store("key", nullptr, [&](const std::string& path) {
    files->writeFile(path, bytesOf("half"));
    store->clear(nullptr, nullptr);
    work().runAll();
    files->writeFile(path, bytesOf("whole"));
    return 5U;
  }));
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_THAT(valueFiles(), IsEmpty());
  expectNothingOf("key");
}

TEST_F(PersistentKeyValueStoreInOneBreath, StoredAnewByTheRunningWriterItselfHoldsTheNewValue) {
  open();
  const Written written = watch(store->store("key", nullptr, [&](const std::string& path) {
    putting("key", "new");
    work().runAll();
    files->writeFile(path, bytesOf("older"));
    return 5U;
  }));
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(contents(), (Contents{{"key", "new"}}));
}

TEST_F(PersistentKeyValueStoreInOneBreath, RemovedAndStoredAnewByTheRunningWriterHoldsTheNewValue) {
  open();
  const Written written = watch(store->store("key", nullptr, [&](const std::string& path) {
    watch(store->removeItem("key"));
    putting("key", "new");
    work().runAll();
    files->writeFile(path, bytesOf("older"));
    return 5U;
  }));
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_EQ(contents(), (Contents{{"key", "new"}}));
  EXPECT_THAT(valueFiles(), ElementsAre("key"));
}

// --- Writers that fail ---

TEST_F(PersistentKeyValueStoreInOneBreath, AFirstWriteThatFailsLeavesNothing) {
  for (const std::optional<std::string>& half : {std::optional<std::string>(), std::optional<std::string>("ha")}) {
    open();
    const Written written = failing("key", half);
    settle();
    EXPECT_EQ(told(written), "<error> The writer gave up.");
    EXPECT_THAT(sizes, IsEmpty());
    expectNothingOf("key");
    close();
  }
}

TEST_F(PersistentKeyValueStoreInOneBreath, AnOverwriteThatFailsLeavesAMiss) {
  for (const std::optional<std::string>& half : {std::optional<std::string>(), std::optional<std::string>("ha")}) {
    open();
    put("key", "old");
    const Written written = failing("key", half);
    settle();
    EXPECT_EQ(told(written), "<error> The writer gave up.");
    expectNothingOf("key");
    close();
  }
}

TEST_F(PersistentKeyValueStoreInOneBreath, AWriteThatFailsLeavesANewerOneItsValue) {
  open();
  put("key", "old");
  const Written failed = failing("key", "half");
  const Fetched between = watch(store->fetch("key"));
  const Written newer = putting("key", "newer");
  settleWorkFirst();
  EXPECT_EQ(told(failed), "<error> The writer gave up.");
  EXPECT_EQ(told(between), "<miss>");
  EXPECT_EQ(told(newer), "<done>");
  EXPECT_EQ(contents(), (Contents{{"key", "newer"}}));
  reopen();
  EXPECT_EQ(contents(), (Contents{{"key", "newer"}}));
}

TEST_F(PersistentKeyValueStoreInOneBreath, ANewerWriteThatFailsTakesTheOlderValueAlong) {
  open();
  putting("key", "older");
  const Written failed = failing("key", std::nullopt);
  settleWorkFirst();
  EXPECT_EQ(told(failed), "<error> The writer gave up.");
  expectNothingOf("key");
}

TEST_F(PersistentKeyValueStoreInOneBreath, AWriterMayThrowAnything) {
  open();
  const Written written =
      watch(store->store("key", nullptr, [](const std::string&) -> unsigned int { throw 42; }));  // NOLINT
  settle();
  EXPECT_TRUE(isA<int>(written->failure));
  expectNothingOf("key");
}

TEST_F(PersistentKeyValueStoreInOneBreath, AWriterThatMakesNoFileLeavesARecordWhoseFetchFailsAndThatCanBeReplaced) {
  open();
  const Written written = watch(store->store("key", nullptr, [](const std::string&) { return 3U; }));
  settle();
  EXPECT_EQ(told(written), "<done>");
  EXPECT_THAT(get("key"), testing::StartsWith("<error> "));
  put("key", "value");
  EXPECT_EQ(get("key"), "value");
}

// --- Every order of two queues ---

// Files in memory, so that thousands of orders are tried in a moment. Only what a store needs; a missing file fails as
// it does on a disk.
class MemoryFiles final : public FileUtils {
 public:
  Contents files;  // by path

  std::vector<unsigned char> readFile(const std::string& path) override {
    throwUnlessThere(path);
    return bytesOf(files[path]);
  }
  void writeFile(const std::string& path, const std::vector<unsigned char>& data) override {
    files[path] = textOf(data);
  }
  void deleteFile(const std::string& path) override {
    throwUnlessThere(path);
    files.erase(path);
  }
  void createDirectory(const std::string& /*path*/, bool /*recursive*/) override {}
  bool isDirectory(const std::string& /*path*/) override { return false; }
  bool pathExists(const std::string& path) override { return files.count(path) > 0; }

 private:
  void throwUnlessThere(const std::string& path) const {
    if (files.count(path) == 0) throw FileUtilsIoException(ENOENT, "There is no " + path);
  }
};

// What a script's letters mean: A and B store a value under "a" and "b"; F fails to store one under "a" halfway; a and
// b remove; g and h fetch "a" and "b"; C clears; P prunes to two bytes, which is one value; I invalidates; X lets go of
// the store; D makes the file queue drop what waits, R makes it refuse what comes from then on.
struct Scenario {
  std::string script;
  Contents before;
  std::optional<std::uint64_t> capacity;
};

// One way of running a script: each choice is who takes the next step, the caller or one of the queues.
class Interleaving {
 public:
  Interleaving(const Scenario& scenario, ManualClock& clock) : scenario_(scenario), model_(scenario.before) {
    DiskCacheOptions options;
    options.directory = "store";
    options.capacity = scenario.capacity;
    options.staleAge = 1000;
    options.normalSize = options.survivalSize = 2;
    options.manifest = std::make_shared<DiskCacheManifest>(std::make_unique<MemoryPersistence>(medium_),
                                                           std::make_shared<test::ManualExecutor>(), nullptr);
    const auto trash = std::make_shared<TrashCollector>("trash", files_, nullptr, nullptr);
    store_ = DiskCache::create(std::move(options), {queues_, trash, files_, nullptr});
    clock.set(KeyValueStoreFixture::kStart);
    for (const auto& item : scenario.before) store_->store(item.first, bytesOf(item.second));
    for (const char* key : {"a", "b"}) {
      const auto item = scenario.before.find(key);
      states_[key].push_back(item == scenario.before.end() ? std::nullopt : std::make_optional(item->second));
    }
    queues_->runAll();
    clock.advance(1);
  }

  std::vector<std::function<void()>> choices() {
    std::vector<std::function<void()>> choices;
    if (next_ < scenario_.script.size()) choices.emplace_back([this] { call(scenario_.script[next_++]); });
    if (work().pending() > 0) choices.emplace_back([this] { work().runNext(); });
    if (file().pending() > 0) choices.emplace_back([this] { file().runNext(); });
    return choices;
  }

  void check() const {
    for (const Written& written : written_) EXPECT_EQ(written->completions, 1);
    for (const Written& written : mustSucceed_) {
      EXPECT_TRUE(written->hasSucceeded() || mayBeCutShort()) << told(written);
    }
    for (const Expectation& expectation : fetched_) {
      const std::string seen = told(expectation.fetched);
      const bool asExpected = seen == expectation.value || (seen == "<miss>" && mayBeMissed(expectation));
      EXPECT_TRUE(asExpected || mayBeCutShort()) << seen << " instead of " << expectation.value;
      EXPECT_FALSE(expectation.fetched->isPending());
    }
    EXPECT_LE(ends_, clearsAndPrunes_);
    EXPECT_TRUE(ends_ == clearsAndPrunes_ || store_ == nullptr) << "a clear or prune never ends";
    checkDisk();
  }

 private:
  struct Expectation {
    Fetched fetched;
    std::string value;  // by the order of the calls
    std::string key;
    std::size_t position;
  };

  test::ManualExecutor& work() const { return *queues_->workQueue(0); }
  test::ManualExecutor& file() const { return *queues_->queue(0); }

  void call(char operation) {
    const std::string value = "v" + std::to_string(next_);
    switch (operation) {
      case 'A':
        return put("a", value);
      case 'B':
        return put("b", value);
      case 'F':
        becomes("a", std::nullopt);
        return written_.push_back(watch(store_->store("a", nullptr, [this](const std::string& path) -> unsigned int {
          files_->writeFile(path, bytesOf("half"));
          throw std::runtime_error("The writer gave up.");
        })));
      case 'a':
        return remove("a");
      case 'b':
        return remove("b");
      case 'g':
        return fetch("a");
      case 'h':
        return fetch("b");
      case 'C':
        return clear();
      case 'P':
        ++clearsAndPrunes_;
        return store_->pruneBackToNormal([this] { ++ends_; }, [this](const std::exception&) { ++ends_; }, false);
      case 'I':
        isInvalidated_ = true;
        return written_.push_back(watch(store_->invalidateWithFuture()));
      case 'D':
        hasFailedQueue_ = true;
        file().dropAll();
        return;
      case 'R':
        hasFailedQueue_ = true;
        return file().throwOnDispatch(true);
      default:
        return store_.reset();
    }
  }

  // The next state of a key.
  void becomes(const std::string& key, const std::optional<std::string>& value) {
    states_[key].push_back(value);
    value ? static_cast<void>(model_[key] = *value) : static_cast<void>(model_.erase(key));
  }

  // A store that has gone answers without having done anything.
  void acknowledge(const std::string& key, std::size_t state) {
    if (store_ != nullptr) acknowledged_[key] = std::max(acknowledged_[key], state);
  }

  // Calls that change a key to its latest state.
  void follow(const std::string& key, Future<void> future) {
    auto outcome = std::make_shared<test::Outcome<test::Done>>();
    future.then(nullptr, [this, outcome, key, state = states_[key].size() - 1](std::future<void>& result) {
      ++outcome->completions;
      try {
        result.get();
        acknowledge(key, state);
      } catch (...) {
        outcome->failure = std::current_exception();
      }
    });
    mustSucceed_.push_back(outcome);
    written_.push_back(outcome);
  }

  void put(const std::string& key, const std::string& value) {
    becomes(key, value);
    follow(key, store_->store(key, bytesOf(value)));
  }

  void remove(const std::string& key) {
    becomes(key, std::nullopt);
    follow(key, store_->removeItem(key));
  }

  void clear() {
    ++clearsAndPrunes_;
    std::map<std::string, std::size_t> cleared;
    for (const char* key : {"a", "b"}) {
      becomes(key, std::nullopt);
      cleared[key] = states_[key].size() - 1;
    }
    store_->clear(
        [this, cleared] {
          ++ends_;
          for (const auto& [key, state] : cleared) expectCleared(key, state);
        },
        [this](const std::exception&) { ++ends_; });
  }

  void expectCleared(const std::string& key, std::size_t state) {
    acknowledge(key, state);
    const bool isStoredSince = states_[key].size() - 1 > state;
    const bool hasFile = files_->pathExists("store/" + key);
    EXPECT_TRUE(isStoredSince || hasFailedQueue_ || store_ == nullptr || !hasFile) << key << " has a file still";
  }

  void fetch(const std::string& key) {
    const auto found = model_.find(key);
    fetched_.push_back({watch(store_->fetch(key)), found == model_.end() ? "<miss>" : found->second, key, next_});
  }

  // Pruned or evicted before it was looked up, or taken away between looking up and reading.
  bool mayBeMissed(const Expectation& expectation) const {
    if (isSelective()) return true;
    const std::string later = scenario_.script.substr(expectation.position);
    return later.find_first_of(expectation.key == "a" ? "aFC" : "bC") != std::string::npos;
  }

  // Whether it depends on the order which items go.
  bool isSelective() const { return scenario_.capacity || scenario_.script.find('P') != std::string::npos; }

  // Whether operations may have ended without being carried out.
  bool mayBeCutShort() const { return isInvalidated_ || hasFailedQueue_ || store_ == nullptr; }

  // Each key is in one of its states since the last that was acknowledged.
  void checkStates(const Contents& values) const {
    if (isSelective()) return;
    for (const auto& [key, states] : states_) {
      const auto value = values.find(key);
      const auto found = value == values.end() ? std::nullopt : std::make_optional(value->second);
      const auto acknowledged = acknowledged_.find(key);
      const std::size_t first = acknowledged == acknowledged_.end() ? 0 : acknowledged->second;
      const auto earliest = states.begin() + static_cast<std::ptrdiff_t>(first);
      const bool isPossible = std::find(earliest, states.end(), found) != states.end();
      EXPECT_TRUE(isPossible) << key << " is " << found.value_or("missing");
    }
  }

  void checkDisk() const {
    Contents files;
    for (const auto& file : files_->files) files[file.first.substr(std::string("store/").size())] = file.second;
    Contents values;
    const auto rows = medium_->rows();
    for (const auto& row : rows) {
      ASSERT_EQ(files.count(row.first), 1U) << "a record without a file: " << row.first;
      EXPECT_EQ(row.second.item.size, files[row.first].size()) << row.first;
      values[row.first] = files[row.first];
    }
    checkStates(values);
    if (store_ == nullptr || hasFailedQueue_) return;  // deletions that had not begun will not begin any more
    for (const auto& file : files) ASSERT_EQ(rows.count(file.first), 1U) << "a file without a record: " << file.first;
    if (isInvalidated_) return;
    for (const auto& file : files) {
      const auto expected = model_.find(file.first);
      ASSERT_NE(expected, model_.end()) << "back again: " << file.first;
      EXPECT_EQ(file.second, expected->second);
    }
    if (!isSelective()) {
      EXPECT_EQ(files.size(), model_.size()) << "a value is lost";
    }
    if (scenario_.capacity) {
      EXPECT_LE(files.size(), std::max<std::uint64_t>(*scenario_.capacity, scenario_.before.size()));
    }
  }

  const Scenario& scenario_;
  Contents model_;  // what the calls so far leave behind, one after the other
  std::map<std::string, std::vector<std::optional<std::string>>> states_;  // of each key, in the order of the calls
  std::map<std::string, std::size_t> acknowledged_;                        // the latest of them that was
  std::size_t next_ = 0;
  bool isInvalidated_ = false;
  bool hasFailedQueue_ = false;
  int clearsAndPrunes_ = 0;
  int ends_ = 0;
  std::vector<Written> written_;
  std::vector<Written> mustSucceed_;
  std::vector<Expectation> fetched_;
  std::shared_ptr<MemoryFiles> files_ = std::make_shared<MemoryFiles>();
  std::shared_ptr<MemoryMedium> medium_ = std::make_shared<MemoryMedium>();
  std::shared_ptr<ManualQueueFactory> queues_ = std::make_shared<ManualQueueFactory>();
  std::shared_ptr<DiskCache> store_;
};

class PersistentKeyValueStoreInEveryOrder : public KeyValueStoreFixture {
 protected:
  // Runs the script in every order there is and checks each; the number of orders.
  std::size_t perform(const Scenario& scenario) {
    std::size_t orders = 0;
    std::vector<std::size_t> path;  // which choice was taken at each step
    do {
      std::string told = scenario.script + " after " + std::to_string(scenario.before.size()) + ", steps";
      std::vector<std::size_t> widths;
      {
        Interleaving interleaving(scenario, clock);
        for (auto choices = interleaving.choices(); !choices.empty(); choices = interleaving.choices()) {
          if (path.size() == widths.size()) path.push_back(0);
          const std::size_t choice = path[widths.size()];
          widths.push_back(choices.size());
          told += " " + std::to_string(choice) + "/" + std::to_string(choices.size());
          choices[choice]();
        }
        SCOPED_TRACE(told);
        interleaving.check();
      }
      ++orders;
      while (!path.empty() && path.back() + 1 == widths[path.size() - 1]) path.pop_back();
      if (!path.empty()) ++path.back();
    } while (!path.empty() && !HasFailure());
    return orders;
  }

  // Every script of that length from those letters.
  static std::vector<std::string> scripts(const std::string& letters, std::size_t length) {
    std::vector<std::string> scripts = {""};
    for (std::size_t i = 0; i < length; ++i) {
      std::vector<std::string> longer;
      for (const std::string& script : scripts) {
        for (const char letter : letters) longer.push_back(script + letter);
      }
      scripts = std::move(longer);
    }
    return scripts;
  }

  void performAll(const std::vector<std::string>& scripts, const std::vector<Contents>& befores,
                  std::optional<std::uint64_t> capacity = std::nullopt, const std::string& suffix = "") {
    for (const std::string& script : scripts) {
      for (const Contents& before : befores) {
        perform({script + suffix, before, capacity});
        if (HasFailure()) return;
      }
    }
  }

  const Contents none{};
  const Contents oldA = {{"a", "old"}};
  const Contents oldB = {{"b", "old"}};
};

// Of calls, tasks of the work queue and tasks of the file queue, of which the second of these may have been done by the
// first.
TEST_F(PersistentKeyValueStoreInEveryOrder, ThereAreAsManyOrdersAsThereAreWaysToMerge) {
  EXPECT_EQ(perform({"A", none, std::nullopt}), 1U);
  EXPECT_EQ(perform({"AA", none, std::nullopt}), 6U);
  EXPECT_EQ(perform({"AAA", none, std::nullopt}), 55U);
}

TEST_F(PersistentKeyValueStoreInEveryOrder, TwoOperationsLeaveWhatTheySay) {
  performAll(scripts("ABFabghCP", 2), {none, oldA, oldB, {{"a", "old"}, {"b", "old"}}});
}

TEST_F(PersistentKeyValueStoreInEveryOrder, ThreeOperationsLeaveWhatTheySay) {
  performAll(scripts("ABFabgCP", 3), {none, oldA, oldB});
}

TEST_F(PersistentKeyValueStoreInEveryOrder, EvictingInBetweenLeavesNoHalves) {
  performAll(scripts("ABag", 3), {none, oldA, oldB}, 1);
  performAll({"AFB", "FAB", "BFA", "BAF"}, {none, oldA, oldB}, 1);
}

TEST_F(PersistentKeyValueStoreInEveryOrder, LongerScriptsLeaveWhatTheySay) {
  performAll({"AaAa", "AaAg", "AgaA", "AFAa", "FAFA", "ACAg"}, {oldA});
}

TEST_F(PersistentKeyValueStoreInEveryOrder, AStoreThatGoesLeavesNoRecordWithoutAFile) {
  performAll(scripts("ABFaCP", 2), {none, oldA, oldB}, std::nullopt, "X");
  performAll(scripts("AB", 2), {none, oldB}, 1, "X");
}

TEST_F(PersistentKeyValueStoreInEveryOrder, AFileQueueThatDropsWhatWaitsLosesNoOlderValue) {
  performAll(scripts("ABFaCP", 2), {none, oldA, oldB}, std::nullopt, "D");
  performAll({"AADg", "ADA", "ADa", "AaDA", "AFDA", "FADA", "ACDA", "ADX", "DAX"}, {oldA});
  performAll(scripts("AB", 2), {none, oldB}, 1, "D");
}

TEST_F(PersistentKeyValueStoreInEveryOrder, AFileQueueThatRefusesLosesNoOlderValue) {
  performAll(scripts("ABFaCP", 2), {none, oldA, oldB}, std::nullopt, "R");
  performAll({"RA", "RAg", "ARA", "RAA", "ARa", "FRA", "ARC", "ARX"}, {none, oldA});
  performAll(scripts("AB", 2), {none, oldB}, 1, "R");
}

TEST_F(PersistentKeyValueStoreInEveryOrder, AnInvalidatedStoreLeavesNoHalves) {
  performAll(scripts("ABFagCP", 2), {none, oldA, oldB}, std::nullopt, "I");
  performAll(scripts("AB", 2), {none, oldB}, 1, "I");
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
