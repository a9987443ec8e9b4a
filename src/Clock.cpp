#include "Clock.h"

#include <atomic>
#include <ctime>

namespace velmora::mobile::xplat::cellar {

namespace {

std::atomic<Clock::Source> currentSource{nullptr};

}  // namespace

std::int64_t Clock::now() {
  const Source source = currentSource.load(std::memory_order_acquire);
  return source != nullptr ? source() : static_cast<std::int64_t>(std::time(nullptr));
}

void Clock::setSource(Source source) { currentSource.store(source, std::memory_order_release); }

}  // namespace velmora::mobile::xplat::cellar
