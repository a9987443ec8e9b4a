#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

#include "tune/TemporaryFile.h"

namespace velmora::mobile::xplat::cellar::tools {

class Trace;

// For each access of a trace, which later one fetches what it leaves: the next access to its key, if that is a fetch
// and nothing is cleared before. In a temporary file, 8 bytes each.
class NextFetches {
 public:
  explicit NextFetches(const Trace& trace);

  // Reads them in order; each thread needs its own.
  class Reader {
   public:
    explicit Reader(const NextFetches& from) : from_(from) {}
    std::uint64_t next();  // `SimulatedCache::kNever` where there is none

   private:
    const NextFetches& from_;
    std::vector<std::uint64_t> block_;
    std::size_t used_ = 0;
    std::uint64_t read_ = 0;
  };

 private:
  TemporaryFile file_;
  const std::uint64_t count_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
