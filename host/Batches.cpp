#include "host/Batches.h"

#include <future>

#include "host/Futures.h"
#include "host/errors/Texts.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

using Fetched = std::unique_ptr<PersistentKeyValueStore::FetchResult>;

// What the operation returns, or throws, as a `BatchError` of its key if it fails.
template <class T, class Operation>
Future<T> attempt(const char* name, const PersistentKeyValueStore& store, const std::string& key, Operation operation) {
  Future<T> future;
  try {
    future = operation();
  } catch (...) {
    Promise<T> promise;
    future = promise.getFuture();
    promise.setException(std::current_exception());
  }
  return then(std::move(future), [name, key, path = store.path](std::future<T>& result) {
    try {
      return result.get();
    } catch (...) {
      throw BatchError(name, key, path);
    }
  });
}

}  // namespace

BatchError::BatchError(const std::string& operation, const std::string& key, const std::string& path)
    : StoreError(joined({"Could not ", operation, ": ", culprit(nameOfDirectory(path), key, path), currentText()}),
                 nameOfDirectory(path), key, path) {}

BatchError::~BatchError() = default;

Future<void> storeAll(PersistentKeyValueStore& store,
                      const std::vector<std::pair<std::string, std::vector<unsigned char>>>& values) {
  std::vector<Future<void>> stored;
  stored.reserve(values.size());
  for (const auto& pair : values) {
    stored.push_back(attempt<void>("store", store, pair.first, [&] { return store.store(pair.first, pair.second); }));
  }
  return whenAll(std::move(stored));
}

Future<std::vector<Fetched>> fetchMany(PersistentKeyValueStore& store, const std::vector<std::string>& keys) {
  std::vector<Future<Fetched>> fetched;
  fetched.reserve(keys.size());
  for (const auto& key : keys) {
    fetched.push_back(attempt<Fetched>("fetch", store, key, [&] { return store.fetch(key); }));
  }
  return whenAll(std::move(fetched));
}

Future<void> removeAll(PersistentKeyValueStore& store, const std::vector<std::string>& keys) {
  std::vector<Future<void>> removed;
  removed.reserve(keys.size());
  for (const auto& key : keys) {
    removed.push_back(attempt<void>("remove", store, key, [&] { return store.removeItem(key); }));
  }
  return whenAll(std::move(removed));
}

}  // namespace velmora::mobile::xplat::cellar::host
