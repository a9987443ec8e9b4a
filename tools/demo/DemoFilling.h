#pragma once

#include <cstddef>
#include <cstdint>

#include "demo/Trees.h"

namespace velmora::mobile::xplat::cellar::tools {

class DemoContext;

// How much the application writes into a store.
struct Filling {
  std::size_t mostFiles;        // into each store
  std::uint64_t coversPercent;  // of the limit of the covers, in pictures
};

// Fills the unmanaged stores that are empty, each with a slice of the source files, the covers with pictures, and shows
// how far it has come. Takes note of what is in them then, and returns what was written.
TreeSize fillEmptyStores(DemoContext& context, const Filling& filling);

}  // namespace velmora::mobile::xplat::cellar::tools
