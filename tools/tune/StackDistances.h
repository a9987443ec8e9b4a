#pragma once

#include <cstdint>
#include <limits>
#include <optional>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// A cache that evicts the least recently used items, at every size limit at once.
//
// The cache of limit L adds each item that is used, and then evicts items, least recently used first, until at most L
// bytes are left. Imagine a stack of all items, the last used one on top. An item is still in that cache exactly
// when, after each use since its own, the items from the top down to it, itself included, had no more than L bytes: the
// greatest of these sums is the least limit that keeps it. Sizes may change with each use. A sum can shrink again, when
// an item above becomes smaller, but what was evicted for it remains evicted.
//
// A tree over the items in the order of their last use keeps each one's sum and the greatest that it has been. A use
// takes time logarithmic in the number of items; memory is linear in it. One thread.
class StackDistances {
 public:
  StackDistances();

  // The item is used, and has `size` bytes from now on. The least limit at which it is found; empty for one that no
  // limit has kept: a new one, or one that was removed.
  std::optional<std::int64_t> use(std::uint32_t key, std::int64_t size);

  // Removes the item. Not an error: one that is not there.
  void remove(std::uint32_t key);

  // Removes all items.
  void clear();

  // The least limit at which nothing has been evicted so far.
  std::int64_t peak() const { return peak_; }

 private:
  using Slot = std::uint32_t;
  static constexpr Slot kNowhere = std::numeric_limits<Slot>::max();

  struct Item {
    Slot slot = kNowhere;  // in the order of last use
    std::int64_t size = 0;
  };

  // In a leaf: an item's sum and the greatest it has been. Above: what is still to be added to all leaves below, and
  // the greatest that this has been on the way.
  struct Node {
    std::int64_t sum = 0;
    std::int64_t greatest = 0;
  };

  std::int64_t takeOut(Item& item);
  void putOnTop(std::uint32_t key, Item& item);
  void makeRoom();
  void rebuild(const std::vector<std::uint32_t>& keys, const std::vector<Node>& leaves);
  void pushDown(std::size_t node);
  static void add(Node& node, const Node& what);

  std::vector<Item> items_;          // by key
  std::vector<std::uint32_t> keys_;  // by slot; kNowhere for none
  std::vector<Node> tree_;           // 1 is the root, the leaves are the second half
  Slot next_ = 0;
  std::uint32_t count_ = 0;
  std::int64_t total_ = 0;
  std::int64_t peak_ = 0;
};

}  // namespace velmora::mobile::xplat::cellar::tools
