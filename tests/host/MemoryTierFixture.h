#pragma once

#include <cstddef>
#include <deque>
#include <future>
#include <memory>
#include <string>

#include "host/MemoryTier.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar::test {

using Value = host::MemoryTier::Value;
using Got = std::shared_ptr<Outcome<Value>>;

inline Got watch(Future<Value> future) {
  auto outcome = std::make_shared<Outcome<Value>>();
  future.then(nullptr, [outcome](std::future<Value>& result) {
    ++outcome->completions;
    try {
      outcome->value = result.get();
    } catch (...) {
      outcome->failure = std::current_exception();
    }
  });
  return outcome;
}

inline std::string told(const Value& value) { return value == nullptr ? "<miss>" : textOf(*value); }

// "<pending>", "<miss>", "<error>" with its text, or the value.
inline std::string told(const Got& got) {
  if (got->isPending()) return "<pending>";
  return got->failure != nullptr ? "<error> " + whatOf(got->failure) : told(*got->value);
}

const std::string kBroken = "<error> " + std::string(std::future_error(std::future_errc::broken_promise).what());

// A tier in front of a store whose queues run when the test says so.
class MemoryTierFixture : public KeyValueStoreFixture {
 public:
  static constexpr std::size_t kRoomy = std::size_t{1} << 20U;

  void openTier(std::size_t maxBytes = kRoomy) {
    open();
    tier = std::make_unique<host::MemoryTier>(store, maxBytes);
  }

  // What the store has, without the tier.
  std::string onDisk(const std::string& key) { return get(key); }

  // What is in memory.
  std::string inMemory(const std::string& key) { return told(tier->find(key)); }

  std::string fetched(const std::string& key) {
    const Got got = watch(tier->fetch(key));
    settle();
    return told(got);
  }

  // Through the tier, to the end.
  void keep(const std::string& key, const std::string& value) {
    const Written written = watch(tier->store(key, bytesOf(value)));
    settle();
    ASSERT_EQ(told(written), "<done>") << key;
  }

  // A producer under the test's control, and how often it was asked.
  host::MemoryTier::Producer producing() {
    return [this] {
      ++productions;
      promises.push_back(std::make_unique<Promise<Bytes>>());
      return promises.back()->getFuture();
    };
  }
  host::MemoryTier::Producer producing(const std::string& value) {
    return [this, value] {
      ++productions;
      Promise<Bytes> promise;
      promise.setValue(bytesOf(value));
      return promise.getFuture();
    };
  }

  int productions = 0;
  std::deque<std::unique_ptr<Promise<Bytes>>> promises;  // of the productions that are under way
  std::unique_ptr<host::MemoryTier> tier;
};

}  // namespace velmora::mobile::xplat::cellar::test
