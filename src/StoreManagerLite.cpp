#include "StoreManagerLite.h"

#include <stdexcept>
#include <utility>

#include "StoreManagerImplCommon.h"

namespace velmora::mobile::xplat::cellar {

StoreManagerLite::StoreManagerLite(const std::string& parentPath, const StoreManagerDefinition& definition,
                                   const std::shared_ptr<FileUtils>& fileUtils,
                                   const std::shared_ptr<StoreDirectoryNameBuilder>& nameBuilder,
                                   const std::shared_ptr<TrashCollector>& trashCollector,
                                   const std::shared_ptr<AttributeStore>& attributeStore)
    : common_(std::make_unique<StoreManagerImplCommon>(parentPath, trashCollector, fileUtils, nameBuilder,
                                                       attributeStore, definition)) {}

StoreManagerLite::~StoreManagerLite() = default;

std::shared_ptr<Store> StoreManagerLite::getStoreImpl(const std::string& identifier) {
  if (!isValid()) return nullptr;
  // Checked before the core makes a slot for the store: whoever asked for it again would wait there without end.
  const auto definition = common_->getStoreDefinition(identifier);
  const bool needsQueues = std::dynamic_pointer_cast<const PKVSDefinition>(definition) != nullptr ||
                           std::dynamic_pointer_cast<const DiskCacheDefinition>(definition) != nullptr;
  if (needsQueues) {
    throw std::logic_error("Store '" + identifier + "' needs a task queue factory, which a lite manager has not.");
  }
  bool created = false;
  return common_->getStore(identifier, nullptr, nullptr, nullptr, nullptr, PruneStrategyIdentifier::Null, created);
}

void StoreManagerLite::invalidate() { common_->invalidate(); }

bool StoreManagerLite::isValid() { return common_->isValid(); }

void StoreManagerLite::setIncidents(std::shared_ptr<const IncidentReporter> incidents) {
  common_->setIncidents(std::move(incidents));
}

}  // namespace velmora::mobile::xplat::cellar
