#include "tune/StackDistances.h"

#include <algorithm>
#include <cstddef>

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::size_t kFewest = 64;  // slots

}  // namespace

StackDistances::StackDistances() { rebuild({}, {}); }

std::optional<std::int64_t> StackDistances::use(std::uint32_t key, std::int64_t size) {
  if (key >= items_.size()) items_.resize(std::size_t{key} + 1);
  Item& item = items_[key];
  std::optional<std::int64_t> least;
  if (item.slot != kNowhere) least = takeOut(item);
  if (next_ == keys_.size()) makeRoom();
  item.size = size;
  putOnTop(key, item);
  return least;
}

void StackDistances::remove(std::uint32_t key) {
  if (key >= items_.size() || items_[key].slot == kNowhere) return;
  (void)takeOut(items_[key]);
}

void StackDistances::clear() {
  for (const std::uint32_t key : keys_) {
    if (key != kNowhere) items_[key].slot = kNowhere;
  }
  total_ = 0;
  count_ = 0;
  rebuild({}, {});
}

// Subtracts its bytes from the items below, and reads its leaf on the way down.
std::int64_t StackDistances::takeOut(Item& item) {
  const Node bytes{-item.size, 0};
  std::size_t node = 1;
  for (std::size_t half = keys_.size() / 2; half > 0; half /= 2) {
    pushDown(node);
    node *= 2;
    if ((item.slot & half) == 0) continue;
    add(tree_[node], bytes);
    ++node;
  }
  keys_[item.slot] = kNowhere;
  item.slot = kNowhere;
  total_ -= item.size;
  --count_;
  return tree_[node].greatest;
}

// Adds its bytes to all items, and resets its own leaf.
void StackDistances::putOnTop(std::uint32_t key, Item& item) {
  add(tree_[1], {item.size, item.size});
  std::size_t node = 1;
  for (std::size_t half = keys_.size() / 2; half > 0; half /= 2) {
    pushDown(node);
    node = node * 2 + ((next_ & half) == 0 ? 0 : 1);
  }
  tree_[node] = {item.size, item.size};
  keys_[next_] = key;
  item.slot = next_++;
  ++count_;
  total_ += item.size;
  peak_ = std::max(peak_, total_);
}

// Each use takes a new slot. When all are used, the items are moved to the first ones.
void StackDistances::makeRoom() {
  const std::size_t slots = keys_.size();
  for (std::size_t node = 1; node < slots; ++node) pushDown(node);
  std::vector<std::uint32_t> keys;
  std::vector<Node> leaves;
  for (std::size_t slot = 0; slot < slots; ++slot) {
    if (keys_[slot] == kNowhere) continue;
    keys.push_back(keys_[slot]);
    leaves.push_back(tree_[slots + slot]);
  }
  rebuild(keys, leaves);
}

void StackDistances::rebuild(const std::vector<std::uint32_t>& keys, const std::vector<Node>& leaves) {
  std::size_t slots = kFewest;
  while (slots < 2 * keys.size()) slots *= 2;
  keys_.assign(slots, kNowhere);
  tree_.assign(2 * slots, Node());
  for (std::size_t slot = 0; slot < keys.size(); ++slot) {
    keys_[slot] = keys[slot];
    tree_[slots + slot] = leaves[slot];
    items_[keys[slot]].slot = static_cast<Slot>(slot);
  }
  next_ = static_cast<Slot>(keys.size());
}

void StackDistances::pushDown(std::size_t node) {
  const Node waiting = tree_[node];
  add(tree_[2 * node], waiting);
  add(tree_[2 * node + 1], waiting);
  tree_[node] = Node();
}

void StackDistances::add(Node& node, const Node& what) {
  node.greatest = std::max(node.greatest, node.sum + what.greatest);
  node.sum += what.sum;
}

}  // namespace velmora::mobile::xplat::cellar::tools
