#include "keyvalue/Rollback.h"

#include "keyvalue/FileWrite.h"
#include "keyvalue/StoreLog.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/ValueFiles.h"

namespace velmora::mobile::xplat::cellar {

void Rollback::end(FileWrite& write) {
  const Token deletion = context_.fileDeletion;
  bool hasStrayFile = false;
  try {
    const StoreLock lock = context_.lock();
    const auto settled = writes_.drop(write);
    if (!settled) return;
    hasStrayFile = settled->hasStrayFile;
    manifest_.recoveringFromDamage(lock, [&] { restore(write.key, *settled); });
  } catch (const std::exception& error) {
    logLostRecord(write.key, error);
  }
  if (hasStrayFile) files_.deleteLeftover(write.key);
}

void Rollback::endAll(const StoreLock& lock) {
  for (const auto& [key, settled] : writes_.dropAll()) {
    tryToRestore(lock, key, settled);
    if (settled.hasStrayFile) files_.deleteLeftover(key);
  }
}

void Rollback::discardRecord(const StoreLock& lock, const std::string& key, bool othersAreInFlight) {
  if (othersAreInFlight) return writes_.settle(key, SettledValue::lost());
  tryToRestore(lock, key, SettledValue::lost());
}

void Rollback::tryToRestore(const StoreLock& /*lock*/, const std::string& key, const SettledValue& settled) {
  try {
    restore(key, settled);
  } catch (const std::exception& error) {
    logLostRecord(key, error);
  }
}

void Rollback::restore(const std::string& key, const SettledValue& settled) {
  const auto manifest = manifest_.get();
  if (settled.isUnknown && files_.exists(key)) return;
  if (settled.record == nullptr) return manifest->removeItem(key);
  manifest->setItem(*settled.record);
  if (settled.record->hasInlineData) manifest->setInlineData(key, settled.inlineData);
}

void Rollback::logLostRecord(const std::string& key, const std::exception& error) const {
  errorLine(__LINE__).stream() << "Store \"" << context_.options.name << "\" could not restore the record of \"" << key
                               << "\": " << error.what();
}

}  // namespace velmora::mobile::xplat::cellar
