#include "host/Await.h"

#include <string>

namespace velmora::mobile::xplat::cellar::host {

TimeoutError::TimeoutError(std::chrono::milliseconds timeout)
    : std::runtime_error("The future had no value after " + std::to_string(timeout.count()) + " ms.") {}

TimeoutError::~TimeoutError() = default;

}  // namespace velmora::mobile::xplat::cellar::host
