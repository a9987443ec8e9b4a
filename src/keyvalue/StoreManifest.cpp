#include "keyvalue/StoreManifest.h"

#include "FileUtils.h"
#include "TrashCollector.h"
#include "keyvalue/StoreLog.h"
#include "keyvalue/WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

namespace {

// Whether the file cannot become a manifest that works, however often it is opened: it is damaged, or holds a table of
// another program's that the manifest's own statements do not fit.
bool isNotAManifest(const ManifestPersistenceException& error) {
  constexpr int kStatementDoesNotFit = 1;
  return dynamic_cast<const ManifestCorruptedException*>(&error) != nullptr || error.code() == kStatementDoesNotFit;
}

}  // namespace

StoreManifest::StoreManifest(StoreContext& context, WritesInFlight& writes)
    : context_(context), writes_(writes), manifest_(context.options.manifest) {}

std::shared_ptr<DiskCacheManifestInterface> StoreManifest::get() {
  if (isCreated_) return manifest_;
  const std::lock_guard<std::mutex> lock(creationMutex_);
  if (manifest_ == nullptr) {
    try {
      manifest_ = open();
    } catch (const ManifestPersistenceException& error) {
      if (!isNotAManifest(error)) throw;
      context_.trash->collectPath(context_.options.directory);
      context_.files->createDirectory(context_.options.directory, true);
      manifest_ = open();
      logPurge(error);
    }
  }
  isCreated_ = true;
  return manifest_;
}

std::shared_ptr<DiskCacheManifestInterface> StoreManifest::open() {
  return DiskCacheManifest::createDiskCacheManifest(context_.manifestPath, context_.workQueue,
                                                    context_.options.extendedMetadataFactory,
                                                    context_.options.pruneStrategy);
}

void StoreManifest::load(const StoreLock& lock) {
  purgingIfDamaged(lock, [&] { get()->load(); });
}

std::unique_ptr<DiskCacheItem> StoreManifest::lookUp(const StoreLock& lock, KeyRange keys) {
  std::unique_ptr<DiskCacheItem> item;
  purgingIfDamaged(lock, [&] {
    finishPurge(lock);
    for (auto key = keys.begin(); key != keys.end() && item == nullptr; ++key) item = get()->getItem(*key);
  });
  return item;
}

bool StoreManifest::changeTogether(const StoreLock& /*lock*/, const std::function<void()>& changes) {
  return isCreated_ && !isPurgePending_ && manifest_->changeTogether(changes);
}

bool StoreManifest::purge(const StoreLock& lock, const LarderException& error) {
  context_.throwIfClosed();
  {
    const auto claimsAreHeld = writes_.holdClaims();
    const bool isCollected = context_.trash->collectPath(context_.options.directory);
    if (!isCollected && context_.files->pathExists(context_.manifestPath)) return false;
    writes_.detachRecords(claimsAreHeld);
    isPurgePending_ = true;
    finishPurge(lock);
  }
  logPurge(error);
  return true;
}

void StoreManifest::finishPurge(const StoreLock& /*lock*/) {
  if (!isPurgePending_) return;
  context_.files->createDirectory(context_.options.directory, true);
  const auto manifest = get();
  manifest->clear();
  manifest->load();
  isPurgePending_ = false;
}

void StoreManifest::logPurge(const LarderException& error) const {
  errorLine(__LINE__).stream() << "Store \"" << context_.options.name << "\" purged due to corrupted manifest. "
                               << error.what();
}

std::optional<std::uint32_t> StoreManifest::totalToReport() {
  if (!context_.options.onSizeChanged) return std::nullopt;
  const auto manifest = get();
  return manifest->isLoaded() ? std::make_optional(manifest->size()) : std::nullopt;
}

void StoreManifest::dispatchReport(std::uint32_t total) {
  context_.workQueue->dispatch([weakContext = context_.weak(context_), total] {
    if (const auto context = weakContext.lock()) context->options.onSizeChanged(total);
  });
}

void StoreManifest::reportSize() {
  if (const auto total = totalToReport()) dispatchReport(*total);
}

void StoreManifest::close() {
  const std::lock_guard<std::mutex> lock(creationMutex_);
  if (manifest_ != nullptr) manifest_->invalidate();
}

}  // namespace velmora::mobile::xplat::cellar
