#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "host/Metrics.h"

namespace velmora::mobile::xplat::cellar {

class PersistentKeyValueStore;
class Store;
class StoreDefinition;

namespace host {

// The limits of a store, as they are before it is created.
StoreMetrics limitsOf(const std::string& identifier, const StoreDefinition& definition);

// What is known of one store, from its creation on. Any thread may call; nobody waits for work in progress.
class StoreFigures : public std::enable_shared_from_this<StoreFigures> {
 public:
  StoreFigures(const std::string& identifier, const StoreDefinition& definition);

  // Also has its work queue note its size, once it is loaded: it does not report that by itself for some minutes.
  void noteCreated(const std::shared_ptr<Store>& store);

  // What a store has reported; also counts its items. On its work queue.
  void noteSize(std::uint64_t bytes);

  // What was measured of an unmanaged store. Without a number of files it is from an earlier run, and counts only as
  // long as nothing else is known.
  void noteMeasured(std::uint64_t bytes, std::optional<std::uint64_t> files);

  void notePruning(std::uint64_t fromBytes);

  // No reader holds the store any more when this returns. The figures stay.
  void release();

  StoreMetrics read();

 private:
  using Lock = std::lock_guard<std::recursive_mutex>;

  void noteLoaded();
  std::shared_ptr<PersistentKeyValueStore> store();
  void noteEndOfPrune(const Lock& lock, std::uint64_t bytes);

  // Held while the store is asked for its counts, so that `release` waits for that. Recursive: if somebody else lets go
  // of the store just then, it is destroyed here, and broken promises may lead to whoever reads the figures.
  std::recursive_mutex mutex_;
  StoreMetrics metrics_;  // guarded, and the store, too
  std::weak_ptr<PersistentKeyValueStore> store_{};
};

}  // namespace host
}  // namespace velmora::mobile::xplat::cellar
