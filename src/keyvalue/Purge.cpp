#include "keyvalue/Purge.h"

#include "DiskCacheManifest.h"
#include "FileUtils.h"
#include "Incident.h"
#include "LarderException.h"
#include "TrashCollector.h"
#include "keyvalue/StoreLog.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

void Purge::recoverOpening(const ManifestPersistenceException& error, int attempt) {
  if (attempt > 0 || !isNotAManifest(error)) throw;
  context_.trash->collectPath(context_.options.directory);
  context_.files->createDirectory(context_.options.directory, true);
}

void Purge::noteOpened(const ManifestPersistenceException& error) { log(error); }

// False, and nothing has changed, when the directory cannot be collected: what the old manifest says would be back at
// the next start. Throws once the store is closed.
ManifestRecovery::Outcome Purge::recoverFromDamage(const StoreLock& lock, const LarderException& error,
                                                   int /*attempt*/) {
  context_.throwIfClosed();
  {
    const auto claimsAreHeld = writes_.holdClaims();
    const bool isCollected = context_.trash->collectPath(context_.options.directory);
    if (!isCollected && context_.files->pathExists(context_.manifestPath)) return Outcome::NotRecovered;
    writes_.detachRecords(claimsAreHeld);
    isPending_ = true;
    prepareReading(lock);
  }
  log(error);
  return Outcome::Emptied;
}

ManifestRecovery::Outcome Purge::recoverFromFailedWrite(const StoreLock& lock,
                                                        const ManifestPersistenceException& error, int attempt) {
  constexpr int kReadOnly = 8;  // SQLite's code for a write to what could be opened for reading only
  return error.code() == kReadOnly ? Outcome::NotRecovered : recoverFromDamage(lock, error, attempt);
}

void Purge::prepareReading(const StoreLock& /*lock*/) {
  if (!isPending_) return;
  context_.files->createDirectory(context_.options.directory, true);
  const auto manifest = manifest_.get();
  manifest->clear();
  manifest->load();
  isPending_ = false;
}

void Purge::log(const LarderException& error) const {
  const std::string& name = context_.options.name;
  const std::string text = "Store \"" + name + "\" purged due to corrupted manifest. " + error.what();
  errorLine(__LINE__).stream() << text;
  context_.report({Incident::Kind::StorePurged, name, "", text});
}

}  // namespace velmora::mobile::xplat::cellar
