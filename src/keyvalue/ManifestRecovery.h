#pragma once

#include <cstdint>

#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

class LarderException;
class ManifestPersistenceException;

// What a store does when its manifest cannot be used: a relaxed one gives up all values (Purge), a safe one keeps what
// it can (Salvage).
class ManifestRecovery {
 public:
  enum class Outcome : std::uint8_t {
    NotRecovered,  // nothing has changed: the operation fails
    Emptied,       // the store is empty: the operation is over
    Recovered      // the operation can be tried again
  };

  ManifestRecovery() = default;
  ManifestRecovery(const ManifestRecovery&) = delete;
  ManifestRecovery& operator=(const ManifestRecovery&) = delete;
  virtual ~ManifestRecovery() = default;

  // The manifest is about to be opened, on first use. Throws when that must not be done.
  virtual void prepareOpening() {}

  // It could not be opened: when this returns, it can be tried again. Throws otherwise, the error itself when it is
  // only that opening has failed for the moment. `attempt` counts from 0.
  virtual void recoverOpening(const ManifestPersistenceException& error, int attempt) = 0;

  // The manifest is open now, where it could not be opened before.
  virtual void noteOpened(const ManifestPersistenceException& /*error*/) {}

  // An operation found it damaged, again if `attempt` is not 0.
  virtual Outcome recoverFromDamage(const StoreLock& lock, const LarderException& error, int attempt) = 0;

  // It could not be written, for whatever reason.
  virtual Outcome recoverFromFailedWrite(const StoreLock& lock, const ManifestPersistenceException& error,
                                         int attempt) = 0;

  // The manifest is about to be read or changed.
  virtual void prepareReading(const StoreLock& /*lock*/) {}
  virtual void prepareChange(const StoreLock& /*lock*/) {}

  // Whether changes can be made together just now.
  virtual bool isReady() const { return true; }
};

}  // namespace velmora::mobile::xplat::cellar
