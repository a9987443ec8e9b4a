#include "Future.h"

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

FutureError::FutureError(Code code) : std::logic_error(textOf(code)), code_(code) {}

FutureError::~FutureError() = default;

FutureError::Code FutureError::code() const noexcept { return code_; }

}  // namespace velmora::mobile::xplat::cellar
