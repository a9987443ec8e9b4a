#include "host/figures/ObservedDefinition.h"

#include <utility>

#include "Store.h"
#include "StoreOptions.h"
#include "host/figures/MeasuredSizes.h"
#include "host/figures/StoreFigures.h"

namespace velmora::mobile::xplat::cellar::host {

ObservedDefinition::ObservedDefinition(std::shared_ptr<const StoreDefinition> definition,
                                       std::shared_ptr<StoreFigures> figures,
                                       std::shared_ptr<AnalyticsEventReporter> analytics,
                                       std::shared_ptr<MeasuredSizes> sizes)
    : StoreDefinition(*definition),
      definition_(std::move(definition)),
      figures_(std::move(figures)),
      analytics_(std::move(analytics)),
      sizes_(std::move(sizes)) {}

std::shared_ptr<Store> ObservedDefinition::createStore(
    const std::string& storePath, const std::string& temporaryDirectoryPath,
    std::shared_ptr<TaskQueueFactory> taskQueueFactory, std::shared_ptr<TrashCollector> trashCollector,
    std::shared_ptr<AnalyticsEventReporter> analyticsReporter, std::shared_ptr<FileUtils> fileUtils,
    std::function<void(unsigned int)> sizeChangedCallback, PruneStrategyIdentifier pruneStrategy,
    std::shared_ptr<const StoreDefinition> definition) const {
  const StoreServices services{std::move(taskQueueFactory), std::move(trashCollector), std::move(fileUtils),
                               std::move(analyticsReporter)};
  return createStore(storePath, temporaryDirectoryPath, services, std::move(sizeChangedCallback), pruneStrategy,
                     std::move(definition));
}

std::shared_ptr<Store> ObservedDefinition::createStore(const std::string& storePath,
                                                       const std::string& temporaryDirectoryPath,
                                                       const StoreServices& services,
                                                       std::function<void(unsigned int)> sizeChangedCallback,
                                                       PruneStrategyIdentifier pruneStrategy,
                                                       std::shared_ptr<const StoreDefinition> /*definition*/) const {
  if (type == Type::Unmanaged) sizes_->watch(storePath, figures_);
  StoreServices own = services;
  own.analytics = analytics_;
  // Noted first: what hears of the size may begin a prune at once.
  auto onSizeChanged = [figures = figures_, report = std::move(sizeChangedCallback)](unsigned int size) {
    figures->noteSize(size);
    if (report) report(size);
  };
  auto store = definition_->createStore(storePath, temporaryDirectoryPath, own, std::move(onSizeChanged), pruneStrategy,
                                        definition_);
  figures_->noteCreated(store);
  return store;
}

}  // namespace velmora::mobile::xplat::cellar::host
