#include "host/QueueThreadMark.h"

#include <utility>

namespace velmora::mobile::xplat::cellar::host {

namespace {

thread_local const QueueThreadMark* innermost = nullptr;

}  // namespace

QueueThreadMark::QueueThreadMark(std::function<void(const std::string&)> onRefusal)
    : onRefusal_(std::move(onRefusal)), outer_(std::exchange(innermost, this)) {}

QueueThreadMark::~QueueThreadMark() { innermost = outer_; }

bool QueueThreadMark::tell(const std::string& operation) {
  const QueueThreadMark* const mark = innermost;
  if (mark != nullptr && mark->onRefusal_) mark->onRefusal_(operation);
  return mark != nullptr;
}

}  // namespace velmora::mobile::xplat::cellar::host
