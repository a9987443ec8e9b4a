#include "host/TypedStore.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cerrno>
#include <chrono>
#include <cstddef>
#include <cstdint>
#include <future>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "JsonValue.h"
#include "host/Await.h"
#include "host/ThreadQueueFactory.h"
#include "support/Barrier.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar::host {

// A type whose codec is the host's own, by specialisation.
struct Temperature {
  double celsius = 0;
};
template <> struct DefaultCodec<Temperature> {
  static std::vector<unsigned char> encode(const Temperature& value) {
    return StringCodec::encode(std::to_string(value.celsius));
  }
  static Temperature decode(const std::vector<unsigned char>& bytes) { return {std::stod(StringCodec::decode(bytes))}; }
};

namespace {

using std::string;
using test::Bytes;
using test::bytesOf;
using test::hasNested;
using test::isA;
using test::ManualExecutor;
using test::Outcome;
using test::whatOf;

template <class T> std::shared_ptr<Outcome<std::optional<T>>> watchValue(Future<std::optional<T>> future) {
  auto outcome = std::make_shared<Outcome<std::optional<T>>>();
  future.then(nullptr, [outcome](std::future<std::optional<T>>& result) {
    ++outcome->completions;
    try {
      outcome->value = result.get();
    } catch (...) {
      outcome->failure = std::current_exception();
    }
  });
  return outcome;
}

class TypedStoreTest : public test::KeyValueStoreFixture {
 public:
  TypedStoreTest() { open(); }

  template <class T, class Codec = DefaultCodec<T>> TypedStore<T, Codec> typed() const {
    return TypedStore<T, Codec>(store);
  }

  string done(Future<void> future) const {
    const test::Written written = test::watch(std::move(future));
    settle();
    return told(written);
  }

  template <class T> T valueOf(Future<std::optional<T>> future) const {
    const auto outcome = watchValue(std::move(future));
    settle();
    if (outcome->failure != nullptr) std::rethrow_exception(outcome->failure);
    return std::move(outcome->value.value().value());
  }

  template <class T> std::exception_ptr failureOf(Future<std::optional<T>> future) const {
    const auto outcome = watchValue(std::move(future));
    settle();
    EXPECT_EQ(outcome->completions, 1);
    return outcome->failure;
  }

  template <class T> bool isMiss(Future<std::optional<T>> future) const {
    const auto outcome = watchValue(std::move(future));
    settle();
    return outcome->hasSucceeded() && !outcome->value->has_value();
  }

  // All keys, sorted.
  template <class T> static std::vector<string> keysOf(const TypedStore<T>& values) {
    std::vector<string> keys = values.keys();
    std::sort(keys.begin(), keys.end());
    return keys;
  }
};

TEST_F(TypedStoreTest, ReadsBackWhatWasPut) {
  const auto names = typed<string>();
  EXPECT_EQ(done(names.put("a", "Alice")), "<done>");
  EXPECT_EQ(valueOf(names.get("a")), "Alice");
  EXPECT_TRUE(isMiss(names.get("b")));
  EXPECT_EQ(done(names.put("a", "")), "<done>");
  EXPECT_EQ(valueOf(names.get("a")), "");
}

TEST_F(TypedStoreTest, TakesValuesWithoutConversions) {
  const auto names = typed<string>();
  EXPECT_EQ(done(names.put("literal", "one")), "<done>");
  EXPECT_EQ(done(names.put("view", std::string_view("two and more").substr(0, 3))), "<done>");
  EXPECT_EQ(done(names.put(string("string"), string("t\0e", 3))), "<done>");
  EXPECT_EQ(valueOf(names.get("literal")), "one");
  EXPECT_EQ(valueOf(names.get("view")), "two");
  EXPECT_EQ(valueOf(names.get("string")), string("t\0e", 3));

  EXPECT_EQ(done(typed<Bytes>().put("bytes", {0, 255})), "<done>");
  EXPECT_EQ(valueOf(typed<Bytes>().get("bytes")), (Bytes{0, 255}));
  EXPECT_EQ(done(typed<JsonValue>().put("json", {{"a", 1}})), "<done>");
  EXPECT_EQ(valueOf(typed<JsonValue>().get("json")), JsonValue({{"a", 1}}));
  EXPECT_EQ(done(typed<std::vector<int>>().put("numbers", {1, 2})), "<done>");
  EXPECT_EQ(valueOf(typed<std::vector<int>>().get("numbers")), (std::vector<int>{1, 2}));
  EXPECT_EQ(done(typed<int>().put("number", 7)), "<done>");
  EXPECT_EQ(valueOf(typed<int>().get("number")), 7);
}

TEST_F(TypedStoreTest, TakesTheCodecThatWasSpecialisedForTheType) {
  EXPECT_EQ(done(typed<Temperature>().put("outside", {21.5})), "<done>");
  EXPECT_DOUBLE_EQ(valueOf(typed<Temperature>().get("outside")).celsius, 21.5);
  EXPECT_EQ(get("outside"), "21.500000");
}

TEST_F(TypedStoreTest, KeepsAnOptionalValueApartFromAMiss) {
  struct MaybeCodec {
    static Bytes encode(const std::optional<int>& value) { return value ? TrivialCodec<int>::encode(*value) : Bytes(); }
    static std::optional<int> decode(const Bytes& bytes) {
      return bytes.empty() ? std::nullopt : std::make_optional(TrivialCodec<int>::decode(bytes));
    }
  };
  const auto values = typed<std::optional<int>, MaybeCodec>();
  done(values.put("none", std::nullopt));
  done(values.put("one", 1));
  EXPECT_EQ(valueOf(values.get("none")), std::nullopt);
  EXPECT_EQ(valueOf(values.get("one")), 1);
  EXPECT_TRUE(isMiss(values.get("neither")));
}

TEST_F(TypedStoreTest, KeepsValuesThatCanOnlyBeMoved) {
  struct Codec {
    static Bytes encode(const std::unique_ptr<int>& value) { return TrivialCodec<int>::encode(*value); }
    static std::unique_ptr<int> decode(const Bytes& bytes) {
      return std::make_unique<int>(TrivialCodec<int>::decode(bytes));
    }
  };
  const auto values = typed<std::unique_ptr<int>, Codec>();
  done(values.put("a", std::make_unique<int>(3)));
  EXPECT_EQ(*valueOf(values.get("a")), 3);
}

// --- Keys ---

TEST_F(TypedStoreTest, TakesAnyBytesAsKeys) {
  const std::vector<string> keys = {"", ".", "..", "../x", "a/b", "manifest_v1.sqlite", "A", "a", string("\0\xff", 2)};
  const auto names = typed<string>();
  for (const string& key : keys) EXPECT_EQ(done(names.put(key, "of " + key)), "<done>") << key;
  for (const string& key : keys) EXPECT_EQ(valueOf(names.get(key)), "of " + key);
  std::vector<string> sorted = keys;
  std::sort(sorted.begin(), sorted.end());
  EXPECT_EQ(keysOf(names), sorted);
  EXPECT_TRUE(directory.exists("store/manifest_v1.sqlite"));
  EXPECT_FALSE(directory.exists("x"));
}

TEST_F(TypedStoreTest, TakesAnyBytesAsKeysOfASafeStore) {
  close();
  options.directory = directory.file("safe");
  options.durability = Durability::Safe;
  open();
  const auto names = typed<string>();
  const std::vector<string> keys = {"", "../x", string(85, 'A'), string(85, 'B')};
  for (const string& key : keys) EXPECT_EQ(done(names.put(key, "of " + key)), "<done>") << key;
  for (const string& key : keys) EXPECT_EQ(valueOf(names.get(key)), "of " + key);
  EXPECT_EQ(names.keys().size(), keys.size());
}

TEST_F(TypedStoreTest, KeepsEmptyValuesInAnInlineStoreToo) {
  close();
  options.directory = directory.file("inline");
  options.inlineData = true;
  open();
  done(typed<string>().put("a", ""));
  EXPECT_EQ(valueOf(typed<string>().get("a")), "");
}

TEST_F(TypedStoreTest, RefusesAKeyThatIsTooLongForAFileName) {
  const auto names = typed<string>();
  EXPECT_EQ(done(names.put(string(255, 'a'), "fits")), "<done>");
  EXPECT_EQ(valueOf(names.get(string(255, 'a'))), "fits");
  EXPECT_EQ(done(names.put(string(85, 'A'), "fits")), "<done>");

  const string refusal = "Key '" + string(80, 'a') +
                         "...' of 256 bytes is too long for store 'store': encoded it would exceed the 255 bytes of a "
                         "file name.";
  EXPECT_EQ(done(names.put(string(256, 'a'), "too long")), "<error> " + refusal);
  EXPECT_EQ(done(names.remove(string(256, 'a'))), "<error> " + refusal);
  const std::exception_ptr failure = failureOf(names.get(string(256, 'a')));
  EXPECT_TRUE(isA<std::length_error>(failure));
  EXPECT_EQ(whatOf(failure), refusal);
  EXPECT_TRUE(isA<std::length_error>(failureOf(names.get(string(86, 'A')))));
  EXPECT_EQ(names.keys().size(), 2U);
}

TEST_F(TypedStoreTest, ListsNoKeysThatItCouldNotFind) {
  put("NotEncoded", "x");
  put("plain", "y");
  const auto names = typed<string>();
  done(names.put("Key", "z"));
  EXPECT_EQ(keysOf(names), (std::vector<string>{"Key", "plain"}));
  EXPECT_EQ(valueOf(names.get("plain")), "y");
  EXPECT_TRUE(isMiss(names.get("NotEncoded")));
}

TEST_F(TypedStoreTest, ListsKeysOnlyOnceTheManifestIsLoaded) {
  close();
  openUnloaded();
  const auto names = typed<string>();
  EXPECT_THROW(static_cast<void>(names.keys()), DiskCacheManifestException);
  settle();
  EXPECT_TRUE(names.keys().empty());
}

TEST_F(TypedStoreTest, RemovesAValueAndNothingElse) {
  const auto names = typed<string>();
  done(names.put("A", "1"));
  done(names.put("a", "2"));
  EXPECT_EQ(done(names.remove("A")), "<done>");
  EXPECT_EQ(done(names.remove("A")), "<done>");
  EXPECT_TRUE(isMiss(names.get("A")));
  EXPECT_EQ(keysOf(names), std::vector<string>{"a"});
}

// --- Errors ---

TEST_F(TypedStoreTest, NamesStoreAndKeyOfAValueThatItCannotRead) {
  done(typed<string>().put("My Key", "abc"));
  const std::exception_ptr failure = failureOf(typed<std::int32_t>().get("My Key"));
  ASSERT_TRUE(isA<DecodeError>(failure));
  EXPECT_EQ(whatOf(failure), "The value of 'My Key' in store 'store' cannot be decoded: 3 bytes instead of 4.");
  try {
    std::rethrow_exception(failure);
  } catch (const DecodeError& error) {
    EXPECT_EQ(error.store(), "store");
    EXPECT_EQ(error.key(), "My Key");
    EXPECT_EQ(error.path(), store->path);
    EXPECT_THROW(std::rethrow_if_nested(error), std::invalid_argument);
  }
  EXPECT_EQ(valueOf(typed<string>().get("My Key")), "abc") << "it stays";
}

TEST_F(TypedStoreTest, ShowsALongOrOddKeyShortAndReadable) {
  const auto failing = [this](const string& key) {
    done(typed<string>().put(key, ""));
    return whatOf(failureOf(typed<std::int32_t>().get(key)));
  };
  const string end = " in store 'store' cannot be decoded: 0 bytes instead of 4.";
  EXPECT_EQ(failing(string(80, 'x')), "The value of '" + string(80, 'x') + "'" + end);
  EXPECT_EQ(failing(string(81, 'x')), "The value of '" + string(80, 'x') + "...'" + end);
  EXPECT_EQ(failing(string("a\0b\n\x7f", 5)), "The value of 'a\\x00b\\x0a\\x7f'" + end);
  EXPECT_EQ(failing(string(79, 'x') + "\xc3\xa4y"), "The value of '" + string(79, 'x') + "...'" + end);
  EXPECT_EQ(failing(""), "The value of ''" + end);
}

TEST_F(TypedStoreTest, PassesOnWhateverACodecThrows) {
  struct RudeCodec {
    static Bytes encode(const int& value) {
      if (value < 0) throw std::domain_error("Not that one.");
      return TrivialCodec<int>::encode(value);
    }
    static int decode(const Bytes& /*bytes*/) { throw 42; }
  };
  const auto values = typed<int, RudeCodec>();
  EXPECT_EQ(done(values.put("a", 1)), "<done>");
  EXPECT_EQ(done(values.put("a", -1)), "<error> Store 'store', key 'a', " + store->path + ": Not that one.");
  const std::exception_ptr failure = failureOf(values.get("a"));
  EXPECT_EQ(whatOf(failure), "The value of 'a' in store 'store' cannot be decoded: not a standard exception");
  try {
    std::rethrow_exception(failure);
  } catch (const DecodeError& error) {
    EXPECT_THROW(std::rethrow_if_nested(error), int);
  }
  EXPECT_EQ(valueOf(typed<int>().get("a")), 1) << "a value that cannot be encoded replaces nothing";
}

TEST_F(TypedStoreTest, NamesStoreAndKeyOfWhatFails) {
  const auto names = typed<string>();
  done(names.put("My Key", "1"));
  files->failNext(test::Operation::ReadFile, EIO);
  const std::exception_ptr failure = failureOf(names.get("My Key"));
  EXPECT_TRUE(hasNested<FileUtilsIoException>(failure));
  const string culprit = "Store 'store', key 'My Key', " + store->path + ": ";
  EXPECT_EQ(whatOf(failure).rfind(culprit + "domain: QZLarderIoErrorErrorDomain; code: 5; ", 0), 0U) << whatOf(failure);
  try {
    std::rethrow_exception(failure);
  } catch (const StoreError& error) {
    EXPECT_EQ(error.store(), "store");
    EXPECT_EQ(error.key(), "My Key");
    EXPECT_EQ(error.path(), store->path);
  }
  files->failNext(test::Operation::WriteFile, ENOSPC);
  EXPECT_EQ(done(names.put("My Key", "2")).rfind("<error> " + culprit, 0), 0U);
  files->failNext(test::Operation::DeleteFile, EIO);
  EXPECT_EQ(done(names.put("My Key", "2")), "<done>");
  EXPECT_EQ(done(names.remove("My Key")).rfind("<error> " + culprit, 0), 0U);
}

TEST_F(TypedStoreTest, NamesStoreAndKeyWhenAQueueTakesNoTasks) {
  const auto names = typed<string>();
  work().throwOnDispatch(true);
  file().throwOnDispatch(true);
  const string culprit = "Store 'store', key 'a', " + store->path + ": ";
  EXPECT_EQ(done(names.put("a", "1")).rfind("<error> " + culprit, 0), 0U);
  EXPECT_EQ(done(names.remove("a")).rfind("<error> " + culprit, 0), 0U);
  const std::exception_ptr failure = failureOf(names.get("a"));
  EXPECT_TRUE(isA<StoreError>(failure));
  EXPECT_EQ(whatOf(failure).rfind(culprit, 0), 0U) << whatOf(failure);
}

TEST_F(TypedStoreTest, SaysThatItsStoreIsInvalidAsTheStoreDoes) {
  const auto names = typed<string>();
  store->invalidateWithFuture();
  settle();
  const std::exception_ptr failure = failureOf(names.get("a"));
  EXPECT_TRUE(isA<InvalidatedException>(failure));
  EXPECT_TRUE(hasNested<InvalidatedException>(failure));
  const string named = "domain: QZInvalidatedExceptionErrorDomain; code: 0; description: Store 'store', key 'a', " +
                       store->path + ": Store has been invalidated. .";
  EXPECT_EQ(whatOf(failure), named);
  EXPECT_EQ(done(names.put("a", "1")), "<error> " + named);
  EXPECT_EQ(done(names.remove("a")), "<error> " + named);
  EXPECT_THROW(static_cast<void>(names.keys()), InvalidatedException);
}

TEST_F(TypedStoreTest, NeedsAStore) { EXPECT_THROW(TypedStore<int>(nullptr), std::invalid_argument); }

// --- Codecs with a state, queues, lifetimes ---

struct XorCodec {
  unsigned char key;

  Bytes encode(const string& value) const { return turned(bytesOf(value)); }
  string decode(const Bytes& bytes) const { return test::textOf(turned(bytes)); }
  Bytes turned(Bytes bytes) const {
    for (unsigned char& byte : bytes) byte = static_cast<unsigned char>(byte ^ key);
    return bytes;
  }
};

TEST_F(TypedStoreTest, UsesTheCodecThatItWasGiven) {
  auto secrets = std::make_unique<TypedStore<string, XorCodec>>(store, XorCodec{1});
  const TypedStore<string, XorCodec> copy = *secrets;
  done(secrets->put("a", "bcd"));
  secrets.reset();
  EXPECT_EQ(get("a"), "cbe");
  EXPECT_EQ(valueOf(copy.get("a")), "bcd");
  EXPECT_EQ(valueOf(TypedStore<string, XorCodec>(store, XorCodec{0}).get("a")), "cbe");
}

TEST_F(TypedStoreTest, DecodesOnTheQueueThatItWasGiven) {
  const auto queue = std::make_shared<ManualExecutor>();
  const TypedStore<string> names(store, {}, queue);
  done(names.put("a", "1"));
  const auto hit = watchValue(names.get("a"));
  const auto miss = watchValue(names.get("b"));
  settle();
  EXPECT_TRUE(hit->isPending());
  EXPECT_TRUE(miss->isPending());
  EXPECT_EQ(queue->runAll(), 2U);
  EXPECT_EQ(hit->value.value(), "1");
  EXPECT_EQ(miss->value.value(), std::nullopt);
}

TEST_F(TypedStoreTest, BreaksThePromiseWhenTheQueueDropsTheTask) {
  const auto queue = std::make_shared<ManualExecutor>();
  const TypedStore<string> names(store, {}, queue);
  const auto pending = watchValue(names.get("a"));
  settle();
  queue->dropAll();
  EXPECT_EQ(pending->completions, 1);
  EXPECT_TRUE(isA<std::future_error>(pending->failure));
}

TEST_F(TypedStoreTest, BreaksThePromiseWhenTheStoresQueuesDropTheirTasks) {
  const auto names = std::make_unique<TypedStore<string>>(store);
  const auto pending = watchValue(names->get("a"));
  work().dropAll();
  EXPECT_EQ(pending->completions, 1);
  EXPECT_TRUE(isA<std::future_error>(pending->failure));
}

TEST_F(TypedStoreTest, DecodesAfterTheHandleIsGone) {
  auto names = std::make_unique<TypedStore<string, XorCodec>>(store, XorCodec{1});
  done(names->put("a", "bcd"));
  const auto pending = watchValue(names->get("a"));
  names.reset();
  settle();
  EXPECT_EQ(pending->value.value(), "bcd");
}

TEST_F(TypedStoreTest, KeepsItsStoreButAPendingFetchDoesNot) {
  auto names = std::make_unique<TypedStore<string>>(store);
  const std::weak_ptr<PersistentKeyValueStore> watched = store;
  store.reset();
  EXPECT_FALSE(watched.expired());
  const auto pending = watchValue(names->get("a"));
  names.reset();
  EXPECT_TRUE(watched.expired());
  settle();
  EXPECT_TRUE(pending->hasSucceeded());
  EXPECT_EQ(pending->value.value(), std::nullopt);
}

TEST_F(TypedStoreTest, MayBeUsedInItsOwnCallbacks) {
  const auto names = typed<string>();
  done(names.put("a", "1"));
  string second;
  names.get("a").then(nullptr, [&](std::future<std::optional<string>>& first) {
    names.put("b", first.get().value() + "2");
    names.get("b").then(nullptr, [&](std::future<std::optional<string>>& value) { second = value.get().value(); });
  });
  settle();
  EXPECT_EQ(second, "12");
}

TEST(TypedStoreThreads, UseOneHandleAtTheSameTime) {
  const test::TemporaryDirectory directory;
  const auto queues = std::make_shared<ThreadQueueFactory>();
  const auto files = std::make_shared<FileUtils>();
  StoreServices services{queues, std::make_shared<TrashCollector>(directory.file("trash"), files, nullptr, queues),
                         files, nullptr};
  DiskCacheOptions options;
  options.directory = directory.file("store");
  options.temporaryDirectory = directory.file("temporary");
  options.name = "threads";
  options.normalSize = 1'000'000;
  const TypedStore<string> names(DiskCache::create(options, services), {}, queues->createQueue());
  test::runOnThreads(4, [&](std::size_t thread) {
    for (int i = 0; i < 25; ++i) {
      const string key = "Thread " + std::to_string(thread) + ", key " + std::to_string(i);
      names.put(key, "of " + key);
      EXPECT_EQ(await(names.get(key)), "of " + key);
    }
  });
  EXPECT_EQ(names.keys().size(), 100U);
  queues->drain(std::chrono::hours(1));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
