#pragma once

#include <cstdint>
#include <vector>

#include "inspect/Survey.h"

namespace velmora::mobile::xplat::cellar::tools {

// Empty buckets, youngest and smallest first. They are the same for every store, so that they can be added up.
std::vector<Bucket> ageBuckets();
std::vector<Bucket> sizeBuckets();

// The places of an item of that age (seconds) or size in them. A date in the future has no age.
std::size_t ageBucketOf(std::int64_t age);
std::size_t sizeBucketOf(std::uint64_t bytes);

void addTo(Bucket& bucket, std::uint64_t bytes);

}  // namespace velmora::mobile::xplat::cellar::tools
