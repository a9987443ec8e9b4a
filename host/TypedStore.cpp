#include "host/TypedStore.h"

#include <algorithm>
#include <array>
#include <cstddef>
#include <functional>
#include <map>
#include <mutex>

#include "host/FileNames.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

constexpr std::size_t kShownKey = 80;  // bytes

// A key as messages show it: in quotes, shortened, and without what would end the text or move the cursor.
std::string shown(std::string_view key) {
  constexpr char kDigits[] = "0123456789abcdef";
  std::size_t end = std::min(key.size(), kShownKey);
  while (end > 0 && end < key.size() && (static_cast<unsigned char>(key[end]) & 0xc0) == 0x80) --end;  // within UTF-8
  std::string text = "'";
  for (const char character : key.substr(0, end)) {
    const auto byte = static_cast<unsigned char>(character);
    if (byte < 0x20 || byte == 0x7f) {
      text += {'\\', 'x', kDigits[byte / 16], kDigits[byte % 16]};
    } else {
      text += character;
    }
  }
  return text + (end < key.size() ? "...'" : "'");
}

// What the exception that is being handled says.
std::string currentReason() {
  try {
    throw;
  } catch (const std::exception& error) {
    return error.what();
  } catch (...) {
    return "The codec does not say why.";
  }
}

}  // namespace

DecodeError::DecodeError(std::string store, std::string key, const std::string& reason)
    : std::runtime_error("The value of " + shown(key) + " in store '" + store + "' cannot be decoded: " + reason),
      store_(std::move(store)),
      key_(std::move(key)) {}

DecodeError::~DecodeError() = default;

const std::string& DecodeError::store() const noexcept { return store_; }
const std::string& DecodeError::key() const noexcept { return key_; }

namespace detail {

std::shared_ptr<PersistentKeyValueStore> required(std::shared_ptr<PersistentKeyValueStore> store) {
  if (store == nullptr) throw std::invalid_argument("A TypedStore needs a store.");
  return store;
}

std::string nameOf(const PersistentKeyValueStore& store) {
  const std::size_t end = store.path.find_last_not_of('/') + 1;
  const std::size_t slash = store.path.substr(0, end).rfind('/');
  const std::size_t begin = slash == std::string::npos ? 0 : slash + 1;
  return store.path.substr(begin, end - begin);
}

std::string storedKey(const PersistentKeyValueStore& store, std::string_view key) {
  try {
    return encodeFileName(std::string(key));
  } catch (const std::length_error&) {
    throw std::length_error("Key " + shown(key) + " of " + std::to_string(key.size()) +
                            " bytes is too long for store '" + nameOf(store) +
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

void throwDecodeError(const std::string& store, const std::string& storedKey) {
  std::throw_with_nested(DecodeError(store, decodeFileName(storedKey), currentReason()));
}

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

void ExpiryWatch::removeUnlessPut() {
  const auto store = weakStore_.lock();
  if (store == nullptr) return;
  const std::lock_guard<std::recursive_mutex> inOrder(stripe_.order);
  if (!wasPut_) store->removeItem(storedKey_);
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
