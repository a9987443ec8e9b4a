#pragma once

#include <memory>
#include <string>

#include "Export.h"
#include "StoreDefinition.h"

namespace velmora::mobile::xplat::cellar {

class AttributeStore;
class IncidentReporter;
class StoreDirectoryNameBuilder;
class StoreManagerImplCommon;

// A manager without maintenance, which a host makes itself: it hands out unmanaged stores and never measures, prunes,
// cleanses or cleans up. Any thread may call.
class CELLAR_EXPORT StoreManagerLite {
 public:
  // Creates the manager's directories, with a fresh temporary directory. Throws what the file utilities throw.
  StoreManagerLite(const std::string& parentPath, const StoreManagerDefinition& definition,
                   const std::shared_ptr<FileUtils>& fileUtils,
                   const std::shared_ptr<StoreDirectoryNameBuilder>& nameBuilder,
                   const std::shared_ptr<TrashCollector>& trashCollector,
                   const std::shared_ptr<AttributeStore>& attributeStore);
  ~StoreManagerLite();
  StoreManagerLite(const StoreManagerLite&) = delete;
  StoreManagerLite& operator=(const StoreManagerLite&) = delete;

  // The store of that identifier, created by the first call. Empty once the manager is invalid. Throws
  // `std::logic_error` for an identifier that the manager does not have, and for a key-value store or disk cache: those
  // need queues.
  std::shared_ptr<Store> getStoreImpl(const std::string& identifier);

  // Discards the manager's directory with all its data. A second call does nothing but wait until the first is over;
  // made from within the first, on its thread, it returns at once.
  void invalidate();

  bool isValid();

  // Where stores that could not be created are reported, as `CreationFailed`; null, as at first: nowhere. To be called
  // before several threads use the manager.
  void setIncidents(std::shared_ptr<const IncidentReporter> incidents);

 private:
  const std::unique_ptr<StoreManagerImplCommon> common_;
};

}  // namespace velmora::mobile::xplat::cellar
