#pragma once

#include <string>

#include "Export.h"

namespace velmora::mobile::xplat::cellar {

// The host's analytics sink. The library sends nothing anywhere itself.
struct CELLAR_EXPORT XAnalytics {
  virtual ~XAnalytics() = default;

  // `payload` is a compact JSON object, `time` the seconds since the Unix epoch in decimal, `category` always "perf".
  // Called from whichever thread reports, from several at once. What it throws reaches the component that reported.
  virtual void logEvent(const std::string& eventName, const std::string& category, const std::string& payload,
                        const std::string& time) = 0;
};

}  // namespace velmora::mobile::xplat::cellar
