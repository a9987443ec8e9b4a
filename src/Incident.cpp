#include "Incident.h"

#include <glog/logging.h>

#include <exception>
#include <utility>

namespace velmora::mobile::xplat::cellar {

IncidentReporter::IncidentReporter(std::shared_ptr<executor::AsyncExecutor> queue, Handler handler)
    : queue_(std::move(queue)), handler_(std::make_shared<const Handler>(std::move(handler))) {}

void IncidentReporter::report(Incident incident) const noexcept {
  try {
    queue_->dispatch([handler = handler_, incident = std::move(incident)] { (*handler)(incident); });
  } catch (const std::exception& error) {
    LOG(ERROR) << "Could not report an incident: " << error.what();
  }
}

}  // namespace velmora::mobile::xplat::cellar
