#pragma once

#include <exception>
#include <functional>
#include <memory>
#include <utility>

#include "Future.h"
#include "keyvalue/Chain.h"
#include "keyvalue/KeyRange.h"
#include "keyvalue/KeysAhead.h"
#include "keyvalue/ManifestChange.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

class FileQueue;

// The work queue of a store as its operations see it. It remembers of each change of the manifest which one comes right
// behind it; no other operation is overtaken. Behind an operation that is still on the file queue, those on the same
// key take the way over that queue, too. Any thread may call.
class WorkQueue {
 public:
  WorkQueue(StoreContext& context, FileQueue& fileQueue) : context_(context), fileQueue_(fileQueue) {}

  // Throws what the host's queue throws.
  void dispatch(std::function<void()> task);

  // The same, behind everything that was called before. `onRefused` is called instead of throwing when that becomes
  // clear only later.
  void dispatchBehindAll(std::function<void()> task, std::function<void(const std::exception&)> onRefused);

  // Hands over the task of an operation on these keys, or fails the promise with the reason why not.
  template <class T> void dispatch(KeyRange keys, Promise<T>& promise, std::function<void()> task) {
    try {
      throwIfRefused(keys);
      if (ahead_.containsAny(keys)) return detour(keys, promise, std::move(task));
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
      if (!ahead_.containsAny(keys)) return append(change, std::move(task));
      detourTo(keys, task, [this, change, task] { dispatchChangeHere(change, task); });
    } catch (...) {
      fail(*change, std::current_exception());
    }
  }

  // The same on the file queue, for a change that has just come from there.
  template <class Change> void dispatchChangeHere(const std::shared_ptr<Change>& change, std::function<void()> task) {
    try {
      append(change, std::move(task));
    } catch (...) {
      fail(*change, std::current_exception());
    }
  }

  // An operation on the key that goes over the file queue first.
  std::shared_ptr<KeysAhead::Passage> enterBehind(KeyRange keys) { return ahead_.enter(keys); }

  void throwIfRefused(KeyRange keys) const;

  // The change right behind; null when there is none.
  std::shared_ptr<ManifestChange> next(const ManifestChange& change) { return changes_.after(change); }

 private:
  void append(const std::shared_ptr<ManifestChange>& change, std::function<void()> task);
  void detourTo(KeyRange keys, std::function<void()> task, std::function<void()> dispatchIt);

  // The task keeps the promise alive.
  template <class T> void detour(KeyRange keys, Promise<T>& promise, std::function<void()> task) {
    detourTo(keys, task, [this, &promise, task] {
      try {
        dispatch(task);
      } catch (...) {
        promise.setException(std::current_exception());
      }
    });
  }

  template <class Change> static void fail(Change& change, std::exception_ptr failure) {
    if (change.take()) change.promise.setException(std::move(failure));
  }

  StoreContext& context_;
  FileQueue& fileQueue_;
  KeysAhead ahead_;
  Chain<ManifestChange> changes_;
};

}  // namespace velmora::mobile::xplat::cellar
