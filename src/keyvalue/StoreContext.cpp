#include "keyvalue/StoreContext.h"

#include <algorithm>
#include <stdexcept>

#include "FileUtils.h"
#include "LarderException.h"
#include "SQLiteManifestPersistence.h"

namespace velmora::mobile::xplat::cellar {

namespace {

KeyValueStoreOptions checked(KeyValueStoreOptions options) {
  if (options.durability != Durability::Relaxed && options.manifest != nullptr) {
    throw std::invalid_argument("Store '" + options.name + "' cannot be safe with a manifest of the host's own.");
  }
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
    : options(checked(std::move(storeOptions))),
      files(services.files),
      trash(services.trash),
      analytics(services.analytics),
      incidents(services.incidents),
      manifestPath(pathOfManifest(options, *files)),
      fileQueue(services.queues->createQueue()),
      workQueue(services.queues->createWorkQueue()),
      store_(store) {}

void StoreContext::throwIfInvalid() const {
  if (isInvalidated) throw InvalidatedException("Store has been invalidated.");
}

void StoreContext::report(Incident incident) const {
  if (incidents != nullptr) incidents->report(std::move(incident));
}

void StoreContext::throwIfClosed() const {
  if (isClosed) throwIfInvalid();
}

std::exception_ptr StoreContext::storeIsGone() {
  return std::make_exception_ptr(InvalidatedException("Store has been released."));
}

}  // namespace velmora::mobile::xplat::cellar
