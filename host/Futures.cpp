#include "host/Futures.h"

#include <glog/logging.h>

#include "host/errors/Texts.h"

namespace velmora::mobile::xplat::cellar::host {

FutureMisuseError::FutureMisuseError(Code code) : FutureError(code) {}

FutureMisuseError::~FutureMisuseError() = default;

const char* FutureMisuseError::what() const noexcept {
  switch (code()) {
    case Code::InvalidSharedState:
      return "The future is empty: default constructed, or moved from. Use the one that the operation has returned.";
    case Code::FetchWithCallback:
    case Code::CallbackAlreadySet:
      return "The future has a callback, which gets its value. Copies of a future share one value: either wait for it "
             "or "
             "give it one callback.";
    case Code::ValueAlreadyFetched:
      return "The value of the future has been taken already. Copies of a future share one value: keep the value, or "
             "use "
             "one copy only.";
  }
  return FutureError::what();
}

namespace detail {

// Declared by host/Coroutines.h, which not every compiler can read.
CELLAR_EXPORT void logException(const char* text) noexcept;

void logException(const char* text) noexcept { LOG(ERROR) << text << currentText(); }

}  // namespace detail

}  // namespace velmora::mobile::xplat::cellar::host
