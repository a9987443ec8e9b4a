#include "keyvalue/GroupCommit.h"

#include <cstddef>
#include <exception>
#include <mutex>
#include <utility>

#include "LarderException.h"
#include "keyvalue/StoreManifest.h"

namespace velmora::mobile::xplat::cellar {

namespace {

// So that who waits for the store's mutex does not wait for much longer than for a single change.
constexpr std::size_t kMaxGroupSize = 32;
constexpr std::size_t kMaxGroupBytes = std::size_t{128} << 10U;  // a first change that has more runs alone

}  // namespace

// The task of a change. Does nothing when an earlier one has run it.
void GroupCommit::run(const std::shared_ptr<ManifestChange>& change) {
  if (!change->take()) return;
  if (workQueue_.next(*change) == nullptr) return change->runAlone();
  const Group group = groupBehind(change);
  const bool isCommitted = group.size() > 1 && commit(group);
  std::exception_ptr failure;  // of a callback: the executor's affair, but not the other changes'
  for (const auto& member : group) {
    try {
      isCommitted ? member->finish() : member->runAlone();
    } catch (...) {
      failure = std::current_exception();
    }
  }
  if (failure != nullptr) std::rethrow_exception(failure);
}

GroupCommit::Group GroupCommit::groupBehind(const std::shared_ptr<ManifestChange>& first) {
  Group group;
  group.reserve(kMaxGroupSize);
  group.push_back(first);
  std::size_t bytes = first->bytes();
  while (group.size() < kMaxGroupSize) {
    auto next = workQueue_.next(*group.back());
    if (next == nullptr) break;
    bytes += next->bytes();
    if (bytes > kMaxGroupBytes || !next->take()) break;
    group.push_back(std::move(next));
  }
  return group;
}

void GroupCommit::note(const StoreLock& lock, ManifestChange& change) {
  try {
    change.note(lock);
  } catch (...) {
    change.failure = std::current_exception();
  }
}

// False when nothing has changed.
bool GroupCommit::commit(const Group& group) {
  const std::lock_guard<std::mutex> removing(context_.removalMutex);
  {
    const StoreLock lock = context_.lock();
    if (context_.isInvalidated) return false;
    const auto changeAll = [&] {
      for (const auto& change : group) change->change(lock);
    };
    if (!manifest_.changeTogether(lock, changeAll)) return false;
    for (const auto& change : group) note(lock, *change);
  }
  for (const auto& change : group) change->deleteFile();
  return true;
}

}  // namespace velmora::mobile::xplat::cellar
