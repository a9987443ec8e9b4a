#pragma once

#include <memory>
#include <string>
#include <utility>
#include <vector>

#include <cellar/Export.h>
#include <cellar/Future.h>
#include <cellar/PersistentKeyValueStore.h>
#include <cellar/host/Errors.h>

// Many keys of one store with one future: a `PersistentKeyValueStore`, a `DiskCache`. The operations are called one
// after the other on the caller's thread, as the store's own would be: each by itself, in the order of the keys, so
// that one that fails does not keep the others from being done. Changes that come together on the store's work queue
// share a transaction (up to 32 of them, or 128 KiB of inline values), unless another thread uses the store in between.
//
// The future is fulfilled when all operations are over. If some have failed, it fails with the `BatchError` of the
// first one in the order of the keys; it has the operation's own exception nested (`std::rethrow_if_nested`).
//
// Any thread may call. Neither the store nor the arguments have to outlive the call.
namespace velmora::mobile::xplat::cellar::host {

// The operation on one key of a batch has failed.
class CELLAR_EXPORT BatchError : public StoreError {
 public:
  // To be made while the nested exception is handled. The text is that of a `StoreError` behind what could not be done:
  // "Could not store: Store 'drafts__v1', key 'x', /data/drafts__v1: TEXT".
  BatchError(const std::string& operation, const std::string& key, const std::string& path);
  ~BatchError() override;
};

// Stores each value under its key. Of a key that is there twice the last value stays.
CELLAR_EXPORT Future<void> storeAll(PersistentKeyValueStore& store,
                                    const std::vector<std::pair<std::string, std::vector<unsigned char>>>& values);

// The values of the keys, in the same order; null for a miss. All of them are in memory at once.
[[nodiscard]] CELLAR_EXPORT Future<std::vector<std::unique_ptr<PersistentKeyValueStore::FetchResult>>> fetchMany(
    PersistentKeyValueStore& store, const std::vector<std::string>& keys);

// Removes the keys. Not an error: a key that is not there.
CELLAR_EXPORT Future<void> removeAll(PersistentKeyValueStore& store, const std::vector<std::string>& keys);

}  // namespace velmora::mobile::xplat::cellar::host
