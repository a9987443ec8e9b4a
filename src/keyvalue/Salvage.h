#pragma once

#include <atomic>
#include <string>
#include <vector>

#include "keyvalue/ManifestRecovery.h"

namespace velmora::mobile::xplat::cellar {

class DiskCacheManifestInterface;
class NewManifest;
class StoreManifest;
class VersionedFiles;

// Keeps what can be kept of a safe store whose manifest is damaged or has vanished. An error that may be true for the
// moment only is not taken for damage: the manifest is opened again before it is given up. Then a new one is made of
// the rows that can be read and of the files that tell whose value they are. What cannot be used is moved to the
// directory "quarantine" in that of the store, and stays there.
//
//   manifest_v1.sqlite-new       being made
//   manifest_v1.sqlite-salvaged  complete, to take the place of the damaged one: at the next start, if need be
class Salvage final : public ManifestRecovery {
 public:
  Salvage(StoreContext& context, StoreManifest& manifest, VersionedFiles& files);

  // Finishes what was interrupted. Where the manifest is missing beside its files, makes a new one of these.
  void prepareOpening() override;

  void recoverOpening(const ManifestPersistenceException& error, int attempt) override;
  Outcome recoverFromDamage(const StoreLock& lock, const LarderException& error, int attempt) override;
  Outcome recoverFromFailedWrite(const StoreLock& lock, const ManifestPersistenceException& error,
                                 int attempt) override;

  // Finishes a salvage that has failed in the middle.
  void prepareReading(const StoreLock& lock) override;

  // The same. Goes on with what is there when somebody has removed or replaced the manifest.
  void prepareChange(const StoreLock& lock) override;

  bool isReady() const override { return !isUnderWay_; }

  // Puts it where nobody finds it by mistake, and nothing deletes it. Throws when it cannot be moved.
  void quarantine(const std::string& name);

 private:
  struct Yield;

  void salvage(const std::string& reason);
  void finish();
  void makeNew(DiskCacheManifestInterface* records, Yield& yield);
  void removeUnfinished();
  bool isMissing() const;
  std::string quarantineDirectory();
  void keepRecords(DiskCacheManifestInterface& records, NewManifest& rows, Yield& yield);
  void keepWhatIsThere(NewManifest& rows, Yield& yield);
  void putInPlace();
  void report(const Yield& yield, const std::string& reason);
  bool isThere(const std::string& name) const;
  std::string pathOf(const std::string& name) const;

  StoreContext& context_;
  StoreManifest& manifest_;
  VersionedFiles& files_;
  const std::string newName_;
  const std::string salvagedName_;
  std::atomic<bool> isUnderWay_{false};  // the new manifest is complete, but not in use yet
};

}  // namespace velmora::mobile::xplat::cellar
