#pragma once

#include "keyvalue/ManifestRecovery.h"

namespace velmora::mobile::xplat::cellar {

class StoreManifest;
class WritesInFlight;

// Gives up all values of a relaxed store whose manifest is damaged or cannot be written: the directory goes to the
// trash, and the store begins again.
class Purge final : public ManifestRecovery {
 public:
  Purge(StoreContext& context, StoreManifest& manifest, WritesInFlight& writes)
      : context_(context), manifest_(manifest), writes_(writes) {}

  void recoverOpening(const ManifestPersistenceException& error, int attempt) override;
  void noteOpened(const ManifestPersistenceException& error) override;
  Outcome recoverFromDamage(const StoreLock& lock, const LarderException& error, int attempt) override;

  // A manifest that could not be opened for writing is true for the moment.
  Outcome recoverFromFailedWrite(const StoreLock& lock, const ManifestPersistenceException& error,
                                 int attempt) override;

  // The second half of a purge. On a full disk it can fail; the next operation then tries it again.
  void prepareReading(const StoreLock& lock) override;

  bool isReady() const override { return !isPending_; }

 private:
  void log(const LarderException& error) const;

  StoreContext& context_;
  StoreManifest& manifest_;
  WritesInFlight& writes_;
  bool isPending_ =
      false;  // the directory has gone to the trash, and no new one is there; guarded by the store's mutex
};

}  // namespace velmora::mobile::xplat::cellar
