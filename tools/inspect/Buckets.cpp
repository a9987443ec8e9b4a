#include "inspect/Buckets.h"

#include <array>
#include <cstddef>

namespace velmora::mobile::xplat::cellar::tools {

namespace {

template <class Number> struct Bound {
  const char* label;
  Number below;
};

constexpr std::int64_t kHour = 3600;
constexpr std::int64_t kDay = 24 * kHour;
constexpr std::uint64_t kKilo = 1024;

constexpr std::array<Bound<std::int64_t>, 6> kAges = {{{"< 1 hour", kHour},
                                                       {"< 1 day", kDay},
                                                       {"< 1 week", 7 * kDay},
                                                       {"< 30 days", 30 * kDay},
                                                       {"< 90 days", 90 * kDay},
                                                       {"< 1 year", 365 * kDay}}};
constexpr const char* kOlder = "older";

constexpr std::array<Bound<std::uint64_t>, 7> kSizes = {{{"< 1 KB", kKilo},
                                                         {"< 4 KB", 4 * kKilo},
                                                         {"< 16 KB", 16 * kKilo},
                                                         {"< 64 KB", 64 * kKilo},
                                                         {"< 256 KB", 256 * kKilo},
                                                         {"< 1 MB", 1024 * kKilo},
                                                         {"< 4 MB", 4096 * kKilo}}};
constexpr const char* kLarger = "larger";

template <class Bounds> std::vector<Bucket> bucketsOf(const Bounds& bounds, const char* rest) {
  std::vector<Bucket> buckets;
  buckets.reserve(bounds.size() + 1);
  for (const auto& bound : bounds) buckets.push_back({bound.label});
  buckets.push_back({rest});
  return buckets;
}

template <class Bounds, class Number> std::size_t placeIn(const Bounds& bounds, Number value) {
  std::size_t place = 0;
  while (place < bounds.size() && value >= bounds[place].below) ++place;
  return place;
}

}  // namespace

std::vector<Bucket> ageBuckets() { return bucketsOf(kAges, kOlder); }
std::vector<Bucket> sizeBuckets() { return bucketsOf(kSizes, kLarger); }

std::size_t ageBucketOf(std::int64_t age) { return placeIn(kAges, age); }
std::size_t sizeBucketOf(std::uint64_t bytes) { return placeIn(kSizes, bytes); }

void addTo(Bucket& bucket, std::uint64_t bytes) {
  ++bucket.items;
  bucket.bytes += bytes;
}

}  // namespace velmora::mobile::xplat::cellar::tools
