#include "host/TypedStore.h"

#include <glog/logging.h>

#include <algorithm>
#include <array>
#include <cstddef>
#include <functional>
#include <map>
#include <mutex>
#include <stdexcept>

#include <cellar/LarderException.h>

#include "host/FileNames.h"
#include "host/errors/Texts.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

// Of an expired value; the exception is being handled.
void logFailedRemoval(const std::string& path, const std::string& storedKey) noexcept {
  try {
    detail::throwNamed(path, decodeFileName(storedKey));
  } catch (const InvalidatedException&) {
    // Its session has ended, and the value with it.
  } catch (const std::future_error&) {
    // The host is going. The value stays expired.
  } catch (const std::exception& error) {
    LOG(ERROR) << "An expired value is not removed: " << error.what();
  }
}

}  // namespace

DecodeError::DecodeError(const std::string& key, const std::string& path)
    : StoreError(joined({"The value of ", shown(key), " in store '", nameOfDirectory(path),
                         "' cannot be decoded: ", currentText()}),
                 nameOfDirectory(path), key, path) {}

DecodeError::~DecodeError() = default;

namespace detail {

std::shared_ptr<PersistentKeyValueStore> required(std::shared_ptr<PersistentKeyValueStore> store) {
  if (store == nullptr) throw std::invalid_argument("A TypedStore needs a store.");
  return store;
}

std::string storedKey(const PersistentKeyValueStore& store, std::string_view key) {
  try {
    return encodeFileName(std::string(key));
  } catch (const std::length_error&) {
    throw std::length_error("Key " + shown(key) + " of " + std::to_string(key.size()) +
                            " bytes is too long for store '" + nameOfDirectory(store.path) +
                            "': encoded it would exceed the 255 bytes of a file name.");
  }
}

std::vector<std::string> originalKeys(PersistentKeyValueStore& store) {
  std::vector<std::string> keys;
  for (const std::string& stored : store.getAllKeys()) {
    try {
      keys.push_back(decodeFileName(stored));
    } catch (const std::invalid_argument&) {
      continue;  // not ours
    }
  }
  return keys;
}

void throwDecodeError(const std::string& path, const std::string& key) { throw DecodeError(key, path); }

Future<void> failed(std::exception_ptr failure) {
  Promise<void> promise;
  Future<void> future = promise.getFuture();
  promise.setException(std::move(failure));
  return future;
}

// A part of all keys of all stores, so that their operations seldom wait for one another.
struct ExpiryWatch::Stripe {
  using Key = std::pair<const PersistentKeyValueStore*, std::string>;

  // Held while a put or a removal is handed to its store, which fixes their order, and while a watch begins. Recursive
  // because a store whose queues run tasks at once comes back from there with other operations.
  std::recursive_mutex order;

  // Guards what follows, and the watches. Comes after `order`; alone in the end of a watch, which may come while a
  // queue that is locked destroys its tasks.
  std::mutex mutex;
  std::multimap<Key, ExpiryWatch*> watches{};
};

ExpiryWatch::Stripe& ExpiryWatch::stripeOf(const PersistentKeyValueStore* store, const std::string& storedKey) {
  constexpr std::size_t kStripes = 16;
  static auto* const stripes = new std::array<Stripe, kStripes>;  // never deleted: threads may outlive static objects
  const std::size_t hash = std::hash<std::string>()(storedKey) ^ std::hash<const void*>()(store);
  return (*stripes)[hash % kStripes];
}

ExpiryWatch::ExpiryWatch(const std::shared_ptr<PersistentKeyValueStore>& store, std::string storedKey)
    : weakStore_(store), store_(store.get()), storedKey_(std::move(storedKey)), stripe_(stripeOf(store_, storedKey_)) {
  const std::lock_guard<std::recursive_mutex> inOrder(stripe_.order);
  const std::lock_guard<std::mutex> lock(stripe_.mutex);
  stripe_.watches.emplace(Stripe::Key(store_, storedKey_), this);
}

ExpiryWatch::~ExpiryWatch() {
  const std::lock_guard<std::mutex> lock(stripe_.mutex);
  const auto [begin, end] = stripe_.watches.equal_range(Stripe::Key(store_, storedKey_));
  stripe_.watches.erase(std::find_if(begin, end, [this](const auto& watch) { return watch.second == this; }));
}

void ExpiryWatch::removeUnlessPut() noexcept {
  const auto store = weakStore_.lock();
  if (store == nullptr) return;
  try {
    const std::lock_guard<std::recursive_mutex> inOrder(stripe_.order);
    if (wasPut_) return;
    store->removeItem(storedKey_).then([path = store->path, key = storedKey_](std::future<void>& removed) {
      try {
        removed.get();
      } catch (...) {
        logFailedRemoval(path, key);
      }
    });
  } catch (...) {
    logFailedRemoval(store->path, storedKey_);
  }
}

Future<void> ExpiryWatch::put(PersistentKeyValueStore& store, const std::string& storedKey,
                              const std::vector<unsigned char>& bytes) {
  Stripe& stripe = stripeOf(&store, storedKey);
  const std::lock_guard<std::recursive_mutex> inOrder(stripe.order);
  {
    const std::lock_guard<std::mutex> lock(stripe.mutex);
    const auto [begin, end] = stripe.watches.equal_range(Stripe::Key(&store, storedKey));
    std::for_each(begin, end, [](const auto& watch) { watch.second->wasPut_ = true; });
  }
  return store.store(storedKey, bytes);
}

}  // namespace detail

}  // namespace velmora::mobile::xplat::cellar::host
