#pragma once

#include <cstdint>

namespace velmora::mobile::xplat::cellar::tools {

// The limit of a cache that has only the share `rate` of all keys.
std::int64_t sampledLimit(std::int64_t limit, double rate);

// What the requests of some of the keys say of all requests. A cache of limit L is one of L times the rate for them.
//
// A few keys may have many of the requests, so that the sample has more or fewer requests than its rate says. Such keys
// are found at nearly every limit: the difference is taken for hits, of the mean size.
class SampleScale {
 public:
  // `requests` of all keys; `sampled`, with `sampledBytes`, of those of which the share `rate` was chosen.
  SampleScale(double rate, std::uint64_t requests, std::uint64_t sampled, std::uint64_t sampledBytes);

  // Of the whole, from that of the sample.
  std::int64_t limit(std::int64_t sampled) const;
  std::uint64_t count(std::uint64_t sampled) const;  // of keys, or the like
  std::uint64_t hits(std::uint64_t sampled) const;
  std::uint64_t hitBytes(std::uint64_t sampled) const;
  std::uint64_t requestedBytes() const;
  double hitRate(std::uint64_t sampledHits) const;

 private:
  bool isWhole() const { return rate_ == 1; }

  const double rate_;
  const std::uint64_t requests_;
  const std::uint64_t sampledBytes_;
  const double expected_;  // requests of the sample
  const double missing_;   // of these
  const double meanSize_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
