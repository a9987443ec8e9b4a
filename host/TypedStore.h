#pragma once

#include <chrono>
#include <exception>
#include <future>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <vector>

#include <cellar/Export.h>
#include <cellar/Future.h>
#include <cellar/PersistentKeyValueStore.h>
#include <cellar/executor/AsyncExecutor.h>
#include <cellar/host/Codecs.h>
#include <cellar/host/Errors.h>

namespace velmora::mobile::xplat::cellar::host {

// A value is there, but its codec cannot read it. It stays in the store. What the codec has thrown is nested.
class CELLAR_EXPORT DecodeError : public StoreError {
 public:
  // To be made while the nested exception is handled.
  // "The value of 'key' in store 'drafts__v1' cannot be decoded: TEXT", with a long key shortened.
  DecodeError(const std::string& key, const std::string& path);
  ~DecodeError() override;
};

namespace detail {

using FetchedValue = std::unique_ptr<PersistentKeyValueStore::FetchResult>;

template <class Codec> using Decoded =
    std::decay_t<decltype(std::declval<const Codec&>().decode(std::vector<unsigned char>()))>;

template <class Codec, class T, class = void> struct TakesTimeToLive : std::false_type {};
template <class Codec, class T> struct TakesTimeToLive<
    Codec, T,
    std::void_t<decltype(std::declval<const Codec&>().encode(std::declval<const T&>(), std::chrono::seconds()))>>
    : std::true_type {};

// A text that is not a std::string and is not converted to one by itself.
template <class T, class Text> using IfView =
    std::enable_if_t<std::is_same_v<T, std::string> && std::is_convertible_v<const Text&, std::string_view> &&
                     !std::is_convertible_v<const Text&, std::string>>;

// `store` itself. Throws `std::invalid_argument` for null.
CELLAR_EXPORT std::shared_ptr<PersistentKeyValueStore> required(std::shared_ptr<PersistentKeyValueStore> store);

// The key under which the store has the value. Throws `std::length_error`.
CELLAR_EXPORT std::string storedKey(const PersistentKeyValueStore& store, std::string_view key);

// The keys of the store that `storedKey` can return, as it was given them.
CELLAR_EXPORT std::vector<std::string> originalKeys(PersistentKeyValueStore& store);

// Throws `DecodeError` with the exception that is being handled nested in it.
[[noreturn]] CELLAR_EXPORT void throwDecodeError(const std::string& path, const std::string& key);

CELLAR_EXPORT Future<void> failed(std::exception_ptr failure);

// From before a value is fetched until it has turned out to be expired or not: removes it unless its key has got
// another value meanwhile. Any thread.
class CELLAR_EXPORT ExpiryWatch {
 public:
  ExpiryWatch(const std::shared_ptr<PersistentKeyValueStore>& store, std::string storedKey);
  ~ExpiryWatch();
  ExpiryWatch(const ExpiryWatch&) = delete;
  ExpiryWatch& operator=(const ExpiryWatch&) = delete;

  // A removal that fails is one error line; one that an invalidated store refuses or a queue drops is not.
  void removeUnlessPut() noexcept;

  // Stores a value that the watches of its key know of.
  static Future<void> put(PersistentKeyValueStore& store, const std::string& storedKey,
                          const std::vector<unsigned char>& bytes);

 private:
  struct Stripe;

  static Stripe& stripeOf(const PersistentKeyValueStore* store, const std::string& storedKey);

  const std::weak_ptr<PersistentKeyValueStore> weakStore_;
  const PersistentKeyValueStore* const store_;  // to compare with; it may be gone
  const std::string storedKey_;
  Stripe& stripe_;
  bool wasPut_ = false;  // set under both locks of the stripe, read under the first
};

}  // namespace detail

// Values of a type, in any store with keys:
//
//   TypedStore<std::string> names(host.store<DiskCache>("names"));
//   names.put("https://a.example/?id=1", "Alice");
//   std::optional<std::string> name = await(names.get("https://a.example/?id=1"));
//
// A handle: copies use the same store and the same codec instance, and keep the store alive. Any thread may call, and
// operations on one key take effect in the order of the calls, as with the store itself.
//
// Keys are any bytes: the store gets `encodeFileName` of them, so that none reaches outside its directory. A key whose
// encoded form is longer than 255 bytes (of 256 small letters, or of 86 bytes that are all encoded) fails the operation
// with `std::length_error`; hash such keys. The errors of all operations travel in their futures: those of the codec
// and of the store as a `StoreError` that names store and key, except where `naming` says otherwise.
//
// `put` encodes on the calling thread. `get` decodes on `decodingQueue` if there is one, and its future is fulfilled
// there, for a miss and an error too. Without, that happens on the store's own queues, where it delays the store's
// other operations: give a queue if decoding takes long. A queue that drops the task makes the future a broken promise.
template <class T, class Codec = DefaultCodec<T>> class TypedStore {
  static constexpr bool kExpires =
      std::is_same_v<detail::Decoded<Codec>, std::optional<T>> && detail::TakesTimeToLive<Codec, T>::value;
  static_assert(kExpires || std::is_same_v<detail::Decoded<Codec>, T>,
                "The codec of a TypedStore<T> decodes to T (or, with a time to live, to std::optional<T>).");

 public:
  // Throws `std::invalid_argument` if `store` is null. `decodingQueue` may be null.
  explicit TypedStore(std::shared_ptr<PersistentKeyValueStore> store, Codec codec = Codec(),
                      std::shared_ptr<AsyncExecutor> decodingQueue = nullptr)
      : store_(detail::required(std::move(store))),
        reader_(std::make_shared<const Reader>(Reader{std::move(codec), store_->path})),
        decodingQueue_(std::move(decodingQueue)) {}

  // Stores the value under the key, replacing what is there. Fulfilled when it is written, as
  // `PersistentKeyValueStore::store`. If the codec throws, the key keeps its value.
  Future<void> put(std::string_view key, const T& value) const {
    static_assert(!kExpires, "Say how long this value lives: put(key, value, timeToLive).");
    return putting(
        key, [&](const std::string& storedKey) { return store_->store(storedKey, reader_->codec.encode(value)); });
  }

  // The same with a time to live, for a store whose codec has it (`Expiring`).
  template <class C = Codec, class = std::enable_if_t<detail::TakesTimeToLive<C, T>::value>>
  Future<void> put(std::string_view key, const T& value, std::chrono::seconds timeToLive) const {
    return putting(key, [&](const std::string& storedKey) {
      return detail::ExpiryWatch::put(*store_, storedKey, reader_->codec.encode(value, timeToLive));
    });
  }

  // The same two for texts that are not strings, as `std::string_view`.
  template <class Text, class = detail::IfView<T, Text>>
  Future<void> put(std::string_view key, const Text& value) const {
    return put(key, T(std::string_view(value)));
  }
  template <class Text, class = detail::IfView<T, Text>>
  Future<void> put(std::string_view key, const Text& value, std::chrono::seconds timeToLive) const {
    return put(key, T(std::string_view(value)), timeToLive);
  }

  // The value; empty for a miss. Fails with `DecodeError` if the codec cannot read it, and where
  // `PersistentKeyValueStore::fetch` fails.
  [[nodiscard]] Future<std::optional<T>> get(std::string_view key) const {
    const auto operation = std::make_shared<Get>(reader_, key);
    Future<std::optional<T>> future = operation->promise.getFuture();
    try {
      begin(operation, detail::storedKey(*store_, key));
    } catch (...) {
      operation->promise.setException(std::current_exception());
    }
    return future;
  }

  // Removes the value. Not an error: a key that is not there.
  Future<void> remove(std::string_view key) const {
    return putting(key, [&](const std::string& storedKey) { return store_->removeItem(storedKey); });
  }

  // The keys of all values that `get` can be asked for, in no order; those of expired values are among them until they
  // are removed. Keys that were stored without a TypedStore are left out if they are not an encoded file name. Throws
  // as `PersistentKeyValueStore::getAllKeys`, also before the manifest is loaded.
  [[nodiscard]] std::vector<std::string> keys() const { return detail::originalKeys(*store_); }

 private:
  // What outlives this handle until the last value is decoded.
  struct Reader {
    Codec codec;
    std::string path;  // of the store
  };

  struct Get {
    Get(std::shared_ptr<const Reader> reader_, std::string_view key_) : reader(std::move(reader_)), key(key_) {}

    const std::shared_ptr<const Reader> reader;
    const std::string key;                       // as `get` was given it
    std::unique_ptr<detail::ExpiryWatch> watch;  // null without a time to live
    Promise<std::optional<T>> promise;

    void finish(std::future<detail::FetchedValue>& fetched) {
      std::optional<T> value;
      std::exception_ptr failure;
      try {
        const detail::FetchedValue found = fetched.get();
        if (found != nullptr) decode(*found, value);
        if (watch != nullptr && found != nullptr && !value) watch->removeUnlessPut();
      } catch (...) {
        failure = detail::named(std::current_exception(), reader->path, key);
      }
      failure != nullptr ? promise.setException(failure) : promise.setValue(std::move(value));
    }

    void decode(PersistentKeyValueStore::FetchResult& found, std::optional<T>& value) const {
      try {
        if constexpr (kExpires) {
          value = reader->codec.decode(std::move(found.value));
        } else {
          value.emplace(reader->codec.decode(std::move(found.value)));
        }
      } catch (...) {
        detail::throwDecodeError(reader->path, key);
      }
    }
  };

  void begin(const std::shared_ptr<Get>& operation, const std::string& storedKey) const {
    if constexpr (kExpires) operation->watch = std::make_unique<detail::ExpiryWatch>(store_, storedKey);
    try {
      store_->fetch(storedKey).then(
          decodingQueue_, [operation](std::future<detail::FetchedValue>& fetched) { operation->finish(fetched); });
    } catch (...) {
      detail::throwNamed(store_->path, operation->key);
    }
  }

  template <class Operation> Future<void> putting(std::string_view key, const Operation& operation) const {
    try {
      const std::string storedKey = detail::storedKey(*store_, key);
      try {
        return naming(operation(storedKey), *store_, std::string(key));
      } catch (...) {
        detail::throwNamed(store_->path, std::string(key));
      }
    } catch (...) {
      return detail::failed(std::current_exception());
    }
  }

  std::shared_ptr<PersistentKeyValueStore> store_;
  std::shared_ptr<const Reader> reader_;
  std::shared_ptr<AsyncExecutor> decodingQueue_;
};

}  // namespace velmora::mobile::xplat::cellar::host
