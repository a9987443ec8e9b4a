#pragma once

#include <memory>

#include "Export.h"
#include "ExtendedMetadata.h"

namespace velmora::mobile::xplat::cellar {

struct DiskCacheItem;
enum class PruneStrategyIdentifier : int;

// Says which of two items of a disk cache is removed first when room is needed. Implementations keep no state that
// changes, or guard it: any thread may compare. Objects are made with std::make_shared of their concrete type, which is
// what destroys them: none is ever deleted through a base.
class CELLAR_EXPORT PruneStrategyBase {
 public:
  // True when `a` is to be pruned before `b`. Should be a strict weak order; where it is not, the order of pruning is
  // unspecified. Neither item is null.
  virtual bool compare(const DiskCacheItem* a, const DiskCacheItem* b) const = 0;

 protected:
  PruneStrategyBase() = default;
  PruneStrategyBase(const PruneStrategyBase&) = default;
  PruneStrategyBase& operator=(const PruneStrategyBase&) = default;
  ~PruneStrategyBase() = default;
};

// Least recently used first. Items of the same access date are not ordered.
class CELLAR_EXPORT LRUPruneStrategy : public PruneStrategyBase {
 public:
  bool compare(const DiskCacheItem* a, const DiskCacheItem* b) const override;
};

// Least recently used first, except that a high-priority item counts as if it had been used `priorityWeight` seconds
// later than it was. Two items are compared by their dates alone when either carries no VideoDownloadExtendedMetadata,
// nor a class derived from it. Sums beyond 32 bits wrap. A class derived from this one is asked to compare; this class
// itself is not, so that pruning does not look at every item.
class CELLAR_EXPORT VideoDownloadPruneStrategy : public PruneStrategyBase {
 public:
  static constexpr int lowPriority = 0;
  static constexpr int highPriority = 1;

  // Both are the host's to assign, for the whole process, before it creates its stores: nothing guards them afterwards.
  // With the defaults (0) the order is plain least-recently-used.
  static int priorityWeight;                 // seconds
  static int highPriorityVideoSecondCutoff;  // a chunk up to this second of its video has high priority

  bool compare(const DiskCacheItem* a, const DiskCacheItem* b) const override;

  // `highPriority` for the item types 1, 2 and 3, and for a plain chunk (type 0) whose second lies between 0 and the
  // cutoff, both included; `lowPriority` for everything else.
  int VideoDownloadExtendedMetadataToPriority(const int& chunkSecond,
                                              const VideoDownloadExtendedMetadata::ItemType& itemType) const;
};

// The cache finds more requests when items are of different sizes: what is small and of a size whose items are asked
// for again stays longer than what is large and of a size whose items are not. Each item has a priority, the level of
// the cache plus 1 / sqrt(size), weighted by the share of uses among the fetches and evictions of the sizes between the
// same two powers of two; eviction takes the lowest and lifts the level to it, so that what is not used ages. With
// items of one size the order is that of least recent use. The cache learns the shares while it runs; after a restart
// it starts with the access dates and sizes of its items.
//
// Two items alone do not show that order: to compare, this class is the same as LRUPruneStrategy. A class derived from
// it is asked to compare.
class CELLAR_EXPORT GreedyDualPruneStrategy : public PruneStrategyBase {
 public:
  bool compare(const DiskCacheItem* a, const DiskCacheItem* b) const override;
};

// A strategy as the ordering of items: called with two item pointers, true when the first is to be pruned before the
// second. Copies share the strategy.
class CELLAR_EXPORT Comparator {
 public:
  // Without a strategy: least recently used first.
  explicit Comparator(std::shared_ptr<PruneStrategyBase> strategy = nullptr);

  bool operator()(const DiskCacheItem* a, const DiskCacheItem* b) const;

 private:
  std::shared_ptr<PruneStrategyBase> strategy_;
};

// A new strategy for LRU, VideoDownload and GreedyDual; empty for Null and every other number, which leaves the choice
// to the caller.
CELLAR_EXPORT std::shared_ptr<PruneStrategyBase> PruneStrategyFactory(PruneStrategyIdentifier identifier);

}  // namespace velmora::mobile::xplat::cellar
