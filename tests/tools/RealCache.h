#pragma once

#include <gtest/gtest.h>

#include <cstddef>
#include <cstdint>
#include <exception>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "DiskCache.h"
#include "FileUtils.h"
#include "PruneStrategy.h"
#include "TrashCollector.h"
#include "host/Await.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"
#include "support/TemporaryDirectory.h"
#include "tune/Access.h"

namespace velmora::mobile::xplat::cellar::tools {

// The library's own cache, used as an application uses it: what is not found is stored, and what has another size than
// wanted, too; after that the cache is pruned. Each access is a second after the one before.
class RealCache {
 public:
  explicit RealCache(unsigned int limit, std::shared_ptr<PruneStrategyBase> strategy = nullptr)
      : limit_(limit), strategy_(std::move(strategy)) {
    open();
  }

  // Whether a fetch found its item.
  bool access(const Access& access) {
    clock_.advance(1);
    if (access.kind == AccessKind::Clear) {
      open();
      return false;
    }
    const std::string key = "key" + std::to_string(access.key);
    if (access.kind == AccessKind::Remove) {
      finish(cache_->removeItem(key));
      return false;
    }
    const auto size = static_cast<std::size_t>(access.size);
    if (access.kind == AccessKind::Store) {
      store(key, size);
      return false;
    }
    const auto found = finish(cache_->fetch(key));
    if (found == nullptr || found->value.size() != size) store(key, size);
    return found != nullptr;
  }

 private:
  // As for a new session, whose data has its own directory.
  void open() {
    const auto files = std::make_shared<FileUtils>();
    cache_.reset();
    queues_->runAll();
    directory_.emplace();
    const auto trash = std::make_shared<TrashCollector>(directory_->file("trash"), files, nullptr, queues_);
    cache_ = DiskCache::createDiskCache(directory_->file("cache"), directory_->file("tmp"), "cache", std::nullopt,
                                        1'000'000'000, limit_, 0, true, queues_, nullptr, trash, strategy_, nullptr,
                                        nullptr, files, nullptr, 50);
    queues_->runAll();
  }

  void store(const std::string& key, std::size_t size) {
    finish(cache_->store(key, std::vector<unsigned char>(size, 'x')));
    cache_->pruneBackToNormal([] {}, [](const std::exception& error) { ADD_FAILURE() << error.what(); }, false);
    queues_->runAll();
  }

  template <class T> T finish(Future<T> future) {
    queues_->runAll();
    return host::await(std::move(future));
  }

  const unsigned int limit_;
  const std::shared_ptr<PruneStrategyBase> strategy_;
  test::ManualClock clock_{1'000'000};
  std::optional<test::TemporaryDirectory> directory_;
  std::shared_ptr<test::ManualQueueFactory> queues_ = std::make_shared<test::ManualQueueFactory>();
  std::shared_ptr<DiskCache> cache_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
