#include "host/memory/Request.h"

namespace velmora::mobile::xplat::cellar::host {

Future<Request::Value> Request::join() {
  waiting.emplace_back();
  return waiting.back().getFuture();
}

void Request::deliver(const Value& value, const std::exception_ptr& failure) {
  isDelivered = true;
  std::exception_ptr thrown;
  for (Promise<Value>& promise : waiting) {
    const auto error = failureOf([&] { failure ? promise.setException(failure) : promise.setValue(value); });
    if (error != nullptr) thrown = error;
  }
  if (thrown != nullptr) std::rethrow_exception(thrown);
}

bool takeOut(Requests& requests, const Request& request) {
  const auto found = requests.find(request.key);
  if (found == requests.end() || found->second.get() != &request) return false;
  requests.erase(found);
  return true;
}

}  // namespace velmora::mobile::xplat::cellar::host
