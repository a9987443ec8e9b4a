#include "keyvalue/BatchRemoval.h"

#include <utility>

#include "keyvalue/FileQueue.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/ValueFiles.h"
#include "keyvalue/WorkQueue.h"
#include "keyvalue/WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

BatchRemoval::Items BatchRemoval::take(const Prune& prune) {
  const StoreLock lock = context_.lock();
  context_.throwIfInvalid();
  manifest_.prepareChange(lock);
  Items items;
  if (!manifest_.recoveringFromDamage(lock, [&] { items = prune(lock, *manifest_.get()); })) return {};
  for (DiskCacheItem& item : items) {
    if (writes_.revoke(item.key)) item.filename.clear();  // its file is left to that write
  }
  return items;
}

BatchRemoval::Items BatchRemoval::evict(const Prune& prune) {
  auto items = take(prune);
  StoreContext::count(context_.evictions, items.size());
  return items;
}

void BatchRemoval::run(Provider provider, OnSuccess onSuccess, OnError onError) {
  auto countedProvider = [operation = context_.operation, provider = std::move(provider)] { return provider(); };
  const auto begin = [weakThis = context_.weak(*this), countedProvider = std::move(countedProvider),
                      onSuccess = std::move(onSuccess), onError] {
    if (const auto self = weakThis.lock()) self->step(countedProvider, onSuccess, onError);
  };
  workQueue_.dispatchBehindAll(begin, std::move(onError));
}

void BatchRemoval::step(const Provider& provider, const OnSuccess& onSuccess, const OnError& onError) {
  try {
    context_.throwIfInvalid();
    const Items batch = provider();
    if (!batch.empty()) return deleteThenStep(batch, provider, onSuccess, onError);
    manifest_.reportSize();
  } catch (const std::exception& error) {
    if (onError) onError(error);
    return;
  }
  if (onSuccess) onSuccess();
}

void BatchRemoval::deleteThenStep(const Items& batch, const Provider& provider, const OnSuccess& onSuccess,
                                  const OnError& onError) {
  std::vector<std::string> paths;
  for (const DiskCacheItem& item : batch) {
    if (auto path = files_.fileOf(item)) paths.push_back(std::move(*path));
  }
  const auto goOn = [weakThis = context_.weak(*this), provider, onSuccess, onError](const std::exception_ptr& failure) {
    const auto self = weakThis.lock();
    if (self == nullptr) return;
    try {
      if (failure != nullptr) std::rethrow_exception(failure);
    } catch (const std::exception& error) {
      if (onError) onError(error);
      return;
    }
    self->step(provider, onSuccess, onError);
  };
  deleteFiles(paths).then(nullptr, [queue = context_.workQueue, goOn, onError](std::future<void>& deleted) {
    std::exception_ptr failure;
    try {
      deleted.get();
    } catch (...) {
      failure = std::current_exception();
    }
    try {
      queue->dispatch([goOn, failure] { goOn(failure); });
    } catch (const std::exception& error) {
      if (onError) onError(error);
    }
  });
}

Future<void> BatchRemoval::deleteFiles(const std::vector<std::string>& paths) {
  try {
    context_.throwIfInvalid();
    const Token deletion = paths.empty() ? nullptr : context_.fileDeletion;
    return fileQueue_.run([weakThis = context_.weak(*this), deletion, paths] {
      const auto self = weakThis.lock();
      if (self == nullptr) return;
      self->context_.throwIfClosed();
      self->files_.deleteAll(paths);
    });
  } catch (...) {
    Promise<void> failed;
    failed.setException(std::current_exception());
    return failed.getFuture();
  }
}

}  // namespace velmora::mobile::xplat::cellar
