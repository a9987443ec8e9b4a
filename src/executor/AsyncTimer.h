#pragma once

#include "../Export.h"

namespace velmora::mobile::xplat::executor {

// Handle of a delayed run. Destroying it cancels the run if that has not begun; it never waits for one that has.
struct CELLAR_EXPORT AsyncTimer {
  virtual ~AsyncTimer() = default;
};

}  // namespace velmora::mobile::xplat::executor

namespace velmora::mobile::xplat::cellar {
using executor::AsyncTimer;
}
