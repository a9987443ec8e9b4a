#pragma once

#include <chrono>
#include <cstdint>
#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// How many files, and bytes in them.
struct TreeSize {
  std::uint64_t files = 0;
  std::uint64_t bytes = 0;

  TreeSize& operator+=(const TreeSize& other) {
    files += other.files;
    bytes += other.bytes;
    return *this;
  }
};

// "850 B", "1.2 KB", "12.0 MB": powers of 1024, as in the configuration.
std::string formatSize(std::uint64_t bytes);

// "850 B", "1536 KB", "12 MB": in the largest unit of which it is a whole number
std::string formatWholeSize(std::uint64_t bytes);

// "20,000"
std::string formatCount(std::uint64_t count);

// "1 file", "20,000 files"
std::string formatCount(std::uint64_t count, const std::string& singular, const std::string& plural);

// "0.3 ms", "45 ms", "1.2 s"
std::string formatTime(std::chrono::nanoseconds duration);

// "50 years", "1 day 12 hours", "90 seconds": whole units, as in the configuration
std::string formatDuration(std::uint64_t seconds);

// "1 file, 850 B"
std::string formatFiles(const TreeSize& size);

}  // namespace velmora::mobile::xplat::cellar::tools
