#pragma once

#include <map>
#include <memory>
#include <string>
#include <vector>

#include "host/Metrics.h"

namespace velmora::mobile::xplat::cellar {

class AnalyticsEventReporter;
class Configuration;
struct StoreManagerDefinition;
struct StoreManagerEvent;

namespace host {

class MeasuredSizes;
class StoreFigures;

// The limits of a manager and its stores, as they are before it is built.
ManagerMetrics limitsOf(const StoreManagerDefinition& definition);

// What is known of one manager that has been built, and of its stores. Fixed but for the stores' figures. Any thread.
class ManagerFigures : public std::enable_shared_from_this<ManagerFigures> {
 public:
  explicit ManagerFigures(const StoreManagerDefinition& definition);
  ~ManagerFigures();
  ManagerFigures(const ManagerFigures&) = delete;
  ManagerFigures& operator=(const ManagerFigures&) = delete;

  // What the manager is to be built from, so that its stores are noted here. The stores report to `analytics` directly,
  // which may be null.
  std::shared_ptr<const Configuration> observe(const StoreManagerDefinition& definition,
                                               const std::shared_ptr<AnalyticsEventReporter>& analytics,
                                               const std::shared_ptr<MeasuredSizes>& sizes) const;

  // What the manager is to report to. Passes everything on.
  std::shared_ptr<AnalyticsEventReporter> observe(const std::shared_ptr<AnalyticsEventReporter>& analytics) const;

  void note(const StoreManagerEvent& event) const;

  // As that of each store.
  void release() const;

  ManagerMetrics read() const;

 private:
  std::shared_ptr<StoreFigures> storeOf(const StoreManagerEvent& event, StoreDefinition::Type type) const;

  const ManagerMetrics limits_;
  std::map<std::string, std::shared_ptr<StoreFigures>> stores_;  // by identifier; not changed after construction
};

}  // namespace host
}  // namespace velmora::mobile::xplat::cellar
