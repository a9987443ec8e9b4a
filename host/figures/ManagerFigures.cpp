#include "host/figures/ManagerFigures.h"

#include <utility>

#include "AnalyticsEventReporter.h"
#include "Configuration.h"
#include "StoreDefinition.h"
#include "host/figures/MeasuredSizes.h"
#include "host/figures/ObservedDefinition.h"
#include "host/figures/StoreFigures.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

// A manager reports seldom: when it learns of a store, and before it prunes or empties one.
class ObservedReporter final : public AnalyticsEventReporter {
 public:
  ObservedReporter(std::shared_ptr<const ManagerFigures> figures, std::shared_ptr<AnalyticsEventReporter> analytics)
      : AnalyticsEventReporter(nullptr), figures_(std::move(figures)), analytics_(std::move(analytics)) {}

  void reportEvent(const StoreManagerEvent& event) const override {
    figures_->note(event);
    pass(event);
  }
  void reportEvent(const PersistentKeyValueStoreEvent& event) const override { pass(event); }
  void reportEvent(const DiskSizeCalculatorEvent& event) const override { pass(event); }
  void reportEvent(const TrashCollectorEvent& event) const override { pass(event); }

 private:
  template <class Event> void pass(const Event& event) const {
    if (analytics_ != nullptr) analytics_->reportEvent(event);
  }

  const std::shared_ptr<const ManagerFigures> figures_;
  const std::shared_ptr<AnalyticsEventReporter> analytics_;  // null: nobody else wants to know
};

}  // namespace

ManagerMetrics limitsOf(const StoreManagerDefinition& definition) {
  ManagerMetrics metrics;
  metrics.name = definition.name;
  metrics.isSessionScoped = definition.sessionScoped;
  metrics.maxBytes = definition.maxSize;
  metrics.pruneInterval = definition.pruneInterval;
  std::map<std::string, const StoreDefinition*> sorted;
  for (const auto& [identifier, store] : definition.stores) sorted.emplace(identifier, store.get());
  for (const auto& [identifier, store] : sorted) metrics.stores.push_back(limitsOf(identifier, *store));
  return metrics;
}

ManagerFigures::ManagerFigures(const StoreManagerDefinition& definition) : limits_(limitsOf(definition)) {
  for (const auto& [identifier, store] : definition.stores) {
    stores_.emplace(identifier, std::make_shared<StoreFigures>(identifier, *store));
  }
}

ManagerFigures::~ManagerFigures() = default;

std::shared_ptr<const Configuration> ManagerFigures::observe(const StoreManagerDefinition& definition,
                                                             const std::shared_ptr<AnalyticsEventReporter>& analytics,
                                                             const std::shared_ptr<MeasuredSizes>& sizes) const {
  const auto observed = std::make_shared<StoreManagerDefinition>(definition);
  for (auto& [identifier, store] : observed->stores) {
    store = std::make_shared<const ObservedDefinition>(store, stores_.at(identifier), analytics, sizes);
  }
  return std::make_shared<const Configuration>(
      std::unordered_map<std::string, std::shared_ptr<const StoreManagerDefinition>>{{definition.name, observed}});
}

std::shared_ptr<AnalyticsEventReporter> ManagerFigures::observe(
    const std::shared_ptr<AnalyticsEventReporter>& analytics) const {
  return std::make_shared<ObservedReporter>(shared_from_this(), analytics);
}

void ManagerFigures::note(const StoreManagerEvent& event) const {
  if (event.type == StoreManagerEvent::Type::Pruning) {
    if (const auto store = storeOf(event, StoreDefinition::Type::DiskCache)) store->notePruning(event.currentSize);
  } else if (event.type == StoreManagerEvent::Type::Eviction) {
    if (const auto store = storeOf(event, StoreDefinition::Type::Unmanaged)) store->noteMeasured(0, 0);
  }
}

// The only one that can be meant: an event has the name of a store, which another may have, too. Null if there are two.
std::shared_ptr<StoreFigures> ManagerFigures::storeOf(const StoreManagerEvent& event,
                                                      StoreDefinition::Type type) const {
  std::shared_ptr<StoreFigures> found;
  for (const StoreMetrics& store : limits_.stores) {
    if (store.name != event.storeName || store.type != type || store.maxBytes != event.maxSize) continue;
    if (found != nullptr) return nullptr;
    found = stores_.at(store.identifier);
  }
  return found;
}

void ManagerFigures::release() const {
  for (const auto& [identifier, store] : stores_) store->release();
}

ManagerMetrics ManagerFigures::read() const {
  ManagerMetrics metrics = limits_;
  metrics.isBuilt = true;
  metrics.stores.clear();
  for (const auto& [identifier, store] : stores_) {
    const StoreMetrics& figures = metrics.stores.emplace_back(store->read());
    if (figures.bytes) metrics.bytes = metrics.bytes.value_or(0) + *figures.bytes;
  }
  return metrics;
}

}  // namespace velmora::mobile::xplat::cellar::host
