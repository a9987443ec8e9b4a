#include "keyvalue/StoreContext.h"

#include <algorithm>

#include "FileUtils.h"
#include "LarderException.h"
#include "SQLiteManifestPersistence.h"

namespace velmora::mobile::xplat::cellar {

namespace {

KeyValueStoreOptions inRange(KeyValueStoreOptions options) {
  options.batchSize = std::max(options.batchSize, 1U);
  return options;
}

std::string pathOfManifest(const KeyValueStoreOptions& options, FileUtils& files) {
  std::string path = files.combinePath(options.directory, kManifestFileName);
  files.createDirectory(options.directory, true);
  return path;
}

}  // namespace

StoreContext::StoreContext(Store& store, KeyValueStoreOptions storeOptions, const StoreServices& services)
    : options(inRange(std::move(storeOptions))),
      files(services.files),
      trash(services.trash),
      analytics(services.analytics),
      manifestPath(pathOfManifest(options, *files)),
      fileQueue(services.queues->createQueue()),
      workQueue(services.queues->createWorkQueue()),
      store_(store) {}

void StoreContext::throwIfInvalid() const {
  if (isInvalidated) throw InvalidatedException("Store has been invalidated.");
}

void StoreContext::throwIfClosed() const {
  if (isClosed) throwIfInvalid();
}

}  // namespace velmora::mobile::xplat::cellar
