#include "demo/SkewedOrder.h"

#include <algorithm>
#include <numeric>
#include <random>
#include <utility>

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// The standard's engines give the same numbers everywhere, its distributions and shuffles do not.
using Engine = std::mt19937_64;

std::vector<std::size_t> shuffled(std::size_t count, Engine& engine) {
  std::vector<std::size_t> order(count);
  std::iota(order.begin(), order.end(), std::size_t{0});
  for (std::size_t left = count; left > 1; --left) {
    std::swap(order[left - 1], order[static_cast<std::size_t>(engine() % left)]);
  }
  return order;
}

// For each rank the sum of the shares 1, 1/2, 1/3 ... up to it.
std::vector<double> sharesUpTo(std::size_t count) {
  std::vector<double> shares(count);
  double sum = 0;
  for (std::size_t i = 0; i < count; ++i) shares[i] = sum += 1.0 / static_cast<double>(i + 1);
  return shares;
}

// In [0, 1), with the 53 bits that a double has.
double fraction(Engine& engine) { return static_cast<double>(engine() >> 11U) * 0x1p-53; }

}  // namespace

std::vector<std::size_t> skewedOrder(std::size_t count, std::size_t length, std::uint64_t seed) {
  if (count == 0) return {};
  Engine engine(seed);
  const std::vector<std::size_t> byPopularity = shuffled(count, engine);
  const std::vector<double> shares = sharesUpTo(count);
  std::vector<std::size_t> order(length);
  for (std::size_t& thing : order) {
    const auto rank = std::upper_bound(shares.begin(), shares.end(), fraction(engine) * shares.back());
    thing = byPopularity[std::min(count - 1, static_cast<std::size_t>(rank - shares.begin()))];
  }
  return order;
}

}  // namespace velmora::mobile::xplat::cellar::tools
