#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// How many requests are found, and how many bytes, at every size limit.
//
// Kept for the limits of at most eleven binary digits, for example "50MB" and "700KB", of any magnitude: neighbours are
// less than 0.1 % apart, and at each of them the figures are exact. Memory does not grow with the number of requests.
class HitCurve {
 public:
  struct Point {
    std::int64_t limit = 0;
    std::uint64_t hits = 0;
    std::uint64_t hitBytes = 0;
  };

  // The figures at `exactLimit` are exact in any case.
  explicit HitCurve(std::int64_t exactLimit = 0);

  // A request of an item of that size, which is found at `leastLimit` and above.
  void addHit(std::int64_t leastLimit, std::int64_t size);
  void addMiss(std::int64_t size);  // at every limit
  void add(std::optional<std::int64_t> leastLimit, std::int64_t size) {
    if (leastLimit) return addHit(*leastLimit, size);
    addMiss(size);
  }

  std::uint64_t requests() const { return requests_; }
  std::uint64_t requestedBytes() const { return requestedBytes_; }

  // The figures at a limit; at one with more digits (other than the exact one), those of the next smaller limit.
  Point at(std::int64_t limit) const;

  // At no limit at all.
  Point most() const;

  // The least limit from which on doubling it always brings less than `worth` of all requests (0.01 is one in a
  // hundred). 0 when nothing is found at any limit.
  Point enough(double worth) const;

 private:
  static std::size_t indexOf(std::int64_t limit);
  static std::int64_t limitOf(std::size_t index);
  void sumUp() const;

  const std::int64_t exactLimit_;
  Point exact_;
  std::uint64_t requests_ = 0;
  std::uint64_t requestedBytes_ = 0;
  std::vector<Point> steps_;         // by index, what begins to be found there
  mutable std::vector<Point> sums_;  // by index, all that is found there; empty until asked for
};

}  // namespace velmora::mobile::xplat::cellar::tools
