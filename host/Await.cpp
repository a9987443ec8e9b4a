#include "host/Await.h"

#include <string>

#include "host/queues/Deadline.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

thread_local bool lookoutPays = false;  // the last value came within the longest lookout

}  // namespace

TimeoutError::TimeoutError(std::chrono::milliseconds timeout)
    : std::runtime_error("The future had no value after " + std::to_string(timeout.count()) + " ms.") {}

TimeoutError::~TimeoutError() = default;

namespace detail {

Lookout::Lookout() : begin_(std::chrono::steady_clock::now()) {}

Lookout::~Lookout() { lookoutPays = isShort(); }

bool Lookout::goesOn() const { return lookoutPays && isShort(); }

bool Lookout::isShort() const { return std::chrono::steady_clock::now() - begin_ < kLongestLookout; }

}  // namespace detail

}  // namespace velmora::mobile::xplat::cellar::host
