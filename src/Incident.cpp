#include "Incident.h"

#include <glog/logging.h>

#include <exception>
#include <utility>

namespace velmora::mobile::xplat::cellar {

namespace {

// The outermost one of this thread, or null.
thread_local const IncidentDeferral* currentDeferral = nullptr;

void callLogged(const IncidentReporter::Handler& handler, const Incident& incident) {
  try {
    handler(incident);
  } catch (const std::exception& error) {
    LOG(ERROR) << "The handler of an incident failed: " << error.what();
  } catch (...) {
    LOG(ERROR) << "The handler of an incident failed: unknown exception";
  }
}

}  // namespace

IncidentReporter::IncidentReporter(std::shared_ptr<executor::AsyncExecutor> queue, Handler handler)
    : queue_(std::move(queue)), handler_(std::make_shared<const Handler>(std::move(handler))) {}

void IncidentReporter::report(Incident incident) const noexcept {
  try {
    if (currentDeferral != nullptr) {
      currentDeferral->reports_.emplace_back(
          [reporter = *this, incident = std::move(incident)] { reporter.report(incident); });
    } else {
      queue_->dispatch([handler = handler_, incident = std::move(incident)] { callLogged(*handler, incident); });
    }
  } catch (const std::exception& error) {
    LOG(ERROR) << "Could not report an incident: " << error.what();
  } catch (...) {
    LOG(ERROR) << "Could not report an incident: unknown exception";
  }
}

IncidentDeferral::IncidentDeferral() {
  if (currentDeferral == nullptr) currentDeferral = this;
}

IncidentDeferral::~IncidentDeferral() {
  if (currentDeferral != this) return;
  currentDeferral = nullptr;
  for (const auto& report : reports_) report();
}

}  // namespace velmora::mobile::xplat::cellar
