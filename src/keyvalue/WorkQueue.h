#pragma once

#include <exception>
#include <functional>
#include <memory>
#include <utility>

#include "Future.h"
#include "keyvalue/Chain.h"
#include "keyvalue/KeyRange.h"
#include "keyvalue/ManifestChange.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

// The work queue of a store as its operations see it. It remembers of each change of the manifest which one comes right
// behind it; no other operation is overtaken. Any thread may call.
class WorkQueue {
 public:
  explicit WorkQueue(StoreContext& context) : context_(context) {}

  // Throws what the host's queue throws.
  void dispatch(std::function<void()> task);

  // Hands over the task of an operation on these keys, or fails the promise with the reason why not.
  template <class T> void dispatch(KeyRange keys, Promise<T>& promise, std::function<void()> task) {
    try {
      throwIfRefused(keys);
      dispatch(std::move(task));
    } catch (...) {
      promise.setException(std::current_exception());
    }
  }

  // The same for a change, which another one's task may run before.
  template <class Change>
  void dispatchChange(KeyRange keys, const std::shared_ptr<Change>& change, std::function<void()> task) {
    try {
      throwIfRefused(keys);
      changes_.append(change);
      context_.workQueue->dispatch(std::move(task));
    } catch (...) {
      if (change->take()) change->promise.setException(std::current_exception());
    }
  }

  // The change right behind; null when there is none.
  std::shared_ptr<ManifestChange> next(const ManifestChange& change) { return changes_.after(change); }

 private:
  void throwIfRefused(KeyRange keys) const;

  StoreContext& context_;
  Chain<ManifestChange> changes_;
};

}  // namespace velmora::mobile::xplat::cellar
