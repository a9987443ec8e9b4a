#pragma once

#include <cstddef>
#include <optional>
#include <vector>

#include "support/Fill.h"
#include "support/Places.h"
#include "support/Report.h"

namespace velmora::mobile::xplat::cellar::bench {

// What a benchmark needs to know.
struct Context {
  bool quick = false;
  std::vector<Place> places{};
  std::optional<Place> disk{};  // where a sync has to wait for a medium
  Report& report;
  Manifests& manifests;

  // Whether threads are kept on one processor: both, but for large values in a quick run.
  std::vector<bool> pinnings(std::size_t size) const {
    return quick && size > std::size_t{4096} ? std::vector<bool>{false} : std::vector<bool>{false, true};
  }

  // A number of operations, items or repetitions; smaller in a quick run.
  template <class Number> Number scaled(Number full, Number small) const { return quick ? small : full; }
};

}  // namespace velmora::mobile::xplat::cellar::bench
