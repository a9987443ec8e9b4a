#include "keyvalue/StoreManifest.h"

#include <exception>
#include <utility>

#include "SQLiteManifestPersistence.h"

namespace velmora::mobile::xplat::cellar {

bool isNotAManifest(const ManifestPersistenceException& error) {
  constexpr int kStatementDoesNotFit = 1;
  return dynamic_cast<const ManifestCorruptedException*>(&error) != nullptr || error.code() == kStatementDoesNotFit;
}

StoreManifest::StoreManifest(StoreContext& context) : context_(context), manifest_(context.options.manifest) {}

std::shared_ptr<DiskCacheManifestInterface> StoreManifest::get() {
  if (isCreated_) return manifest_;
  const std::lock_guard<std::mutex> lock(creationMutex_);
  if (manifest_ == nullptr) manifest_ = openRecovering();
  isCreated_ = true;
  return manifest_;
}

std::shared_ptr<DiskCacheManifestInterface> StoreManifest::openRecovering() {
  std::optional<ManifestPersistenceException> failure;
  for (int attempt = 0;; ++attempt) {
    try {
      recovery_->prepareOpening();
      auto manifest = open();
      if (failure) recovery_->noteOpened(*failure);
      return manifest;
    } catch (const ManifestPersistenceException& error) {
      recovery_->recoverOpening(error, attempt);
      failure = error;
    }
  }
}

std::shared_ptr<DiskCacheManifestInterface> StoreManifest::open() {
  const auto& options = context_.options;
  auto persistence = std::make_unique<SQLiteManifestPersistence>(context_.manifestPath, options.extendedMetadataFactory,
                                                                 SQLiteStoreFactory(), options.durability);
  return std::make_shared<DiskCacheManifest>(std::move(persistence), context_.workQueue, options.pruneStrategy,
                                             options.durability);
}

bool StoreManifest::recoveringFromDamage(const StoreLock& lock, FunctionReference operation) {
  for (int attempt = 0;; ++attempt) {
    try {
      operation();
      return true;
    } catch (const ManifestCorruptedException& error) {
      const Outcome outcome = recovery_->recoverFromDamage(lock, error, attempt);
      if (outcome == Outcome::NotRecovered) throw;
      if (outcome == Outcome::Emptied) return false;
    }
  }
}

bool StoreManifest::recoveringFromFailedWrite(const StoreLock& lock, FunctionReference operation) {
  for (int attempt = 0;; ++attempt) {
    try {
      operation();
      return true;
    } catch (const ManifestPersistenceException& error) {
      const Outcome outcome = recovery_->recoverFromFailedWrite(lock, error, attempt);
      if (outcome == Outcome::NotRecovered) throw;
      if (outcome == Outcome::Emptied) return false;
    }
  }
}

void StoreManifest::load(const StoreLock& lock) {
  recoveringFromDamage(lock, [&] { get()->load(); });
}

std::unique_ptr<DiskCacheItem> StoreManifest::lookUp(const StoreLock& lock, KeyRange keys) {
  std::unique_ptr<DiskCacheItem> item;
  recoveringFromDamage(lock, [&] {
    recovery_->prepareReading(lock);
    for (auto key = keys.begin(); key != keys.end() && item == nullptr; ++key) item = get()->getItem(*key);
  });
  return item;
}

bool StoreManifest::changeTogether(const StoreLock& lock, const std::function<void()>& changes) {
  if (!isCreated_ || !recovery_->isReady()) return false;
  try {
    recovery_->prepareChange(lock);
  } catch (const std::exception&) {
    return false;
  }
  return manifest_->changeTogether(changes);
}

void StoreManifest::recover(const StoreLock& lock, const LarderException& error) {
  constexpr int kForSure = 1;
  if (recovery_->recoverFromDamage(lock, error, kForSure) != Outcome::NotRecovered) return;
  throw LarderException(error.description(), error.domain(), error.code());
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
