#pragma once

#include <cstdint>
#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// Chooses a share of all keys by their hash: the same ones in every log, of which all accesses are chosen.
class KeySample {
 public:
  // 0 < `rate` <= 1
  explicit KeySample(double rate = 1);

  double rate() const { return rate_; }
  bool isWhole() const { return rate_ == 1; }
  bool has(const std::string& key) const { return isWhole() || hashOf(key) < end_; }

  // FNV-1a of 32 bits over the bytes of the key, mixed so that every bit of it counts in every bit. It never changes:
  // logs of different devices and versions are sampled alike.
  static std::uint32_t hashOf(const std::string& key);

 private:
  double rate_;
  std::uint64_t end_;  // of the hashes that are chosen
};

// "0.01" or "1%". Throws `InputError` for what is not a share of more than nothing and at most all.
double parseRate(const std::string& text);

}  // namespace velmora::mobile::xplat::cellar::tools
