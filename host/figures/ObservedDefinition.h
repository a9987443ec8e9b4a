#pragma once

#include <functional>
#include <memory>
#include <string>

#include "StoreDefinition.h"

namespace velmora::mobile::xplat::cellar::host {

class MeasuredSizes;
class StoreFigures;

// Creates the stores of another definition, and has their figures noted.
class ObservedDefinition final : public StoreDefinition {
 public:
  ObservedDefinition(std::shared_ptr<const StoreDefinition> definition, std::shared_ptr<StoreFigures> figures,
                     std::shared_ptr<AnalyticsEventReporter> analytics, std::shared_ptr<MeasuredSizes> sizes);
  ~ObservedDefinition() = default;

  std::shared_ptr<Store> createStore(const std::string& storePath, const std::string& temporaryDirectoryPath,
                                     std::shared_ptr<TaskQueueFactory> taskQueueFactory,
                                     std::shared_ptr<TrashCollector> trashCollector,
                                     std::shared_ptr<AnalyticsEventReporter> analyticsReporter,
                                     std::shared_ptr<FileUtils> fileUtils,
                                     std::function<void(unsigned int)> sizeChangedCallback,
                                     PruneStrategyIdentifier pruneStrategy,
                                     std::shared_ptr<const StoreDefinition> definition) const override;

  // The store has the other definition, and reports to the analytics that this was made with.
  std::shared_ptr<Store> createStore(const std::string& storePath, const std::string& temporaryDirectoryPath,
                                     const StoreServices& services,
                                     std::function<void(unsigned int)> sizeChangedCallback,
                                     PruneStrategyIdentifier pruneStrategy,
                                     std::shared_ptr<const StoreDefinition> definition) const override;

 private:
  const std::shared_ptr<const StoreDefinition> definition_;
  const std::shared_ptr<StoreFigures> figures_;
  const std::shared_ptr<AnalyticsEventReporter> analytics_;  // may be null
  const std::shared_ptr<MeasuredSizes> sizes_;
};

}  // namespace velmora::mobile::xplat::cellar::host
