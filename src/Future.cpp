#include "Future.h"

#include <glog/logging.h>

namespace velmora::mobile::xplat::cellar {

namespace {

const char* textOf(FutureError::Code code) {
  switch (code) {
    case FutureError::Code::InvalidSharedState:
      return "Shared state is invalid";
    case FutureError::Code::FetchWithCallback:
      return "Value may not be fetched if a callback is set";
    case FutureError::Code::CallbackAlreadySet:
      return "Callback may not be set again";
    case FutureError::Code::ValueAlreadyFetched:
      break;
  }
  return "Unknown error";
}

}  // namespace

namespace detail {

void logExceptionOfBrokenPromise() noexcept {
  constexpr const char* kText = "A callback of a broken promise has failed: ";
  try {
    throw;
  } catch (const std::exception& error) {
    LOG(ERROR) << kText << error.what();
  } catch (...) {
    LOG(ERROR) << kText << "not a standard exception";
  }
}

}  // namespace detail

FutureError::FutureError(Code code) : std::logic_error(textOf(code)), code_(code) {}

FutureError::~FutureError() = default;

FutureError::Code FutureError::code() const noexcept { return code_; }

}  // namespace velmora::mobile::xplat::cellar
