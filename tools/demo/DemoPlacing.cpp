#include "demo/DemoPlacing.h"

#include <array>
#include <cstdint>
#include <limits>

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// Values that are placed at the least, and bytes that may be placed again and again to reach that number.
constexpr std::size_t kFewestValues = 1000;
constexpr std::uint64_t kMostRepeatedBytes = 8U << 20U;

constexpr int kSecondsOfAVideo = 60;

// The caches together must leave their manager within its limit until the time to go over it has come.
struct Shelf {
  const char* store;
  const char* keyPrefix;
  std::uint64_t largest;    // bytes of a value
  std::uint64_t mostBytes;  // of all values
  std::size_t mostValues;
  std::uint64_t bytes;
  std::size_t values;

  bool hasRoomFor(std::uint64_t size) const {
    return size <= largest && bytes + size <= mostBytes && values < mostValues;
  }
};

class Placing {
 public:
  explicit Placing(const SourceFiles& source) : source_(source) {}

  std::vector<Placement> all() {
    for (std::size_t file = 0; file < source_.files.size(); ++file) place(file);
    std::uint64_t repeated = 0;
    for (std::size_t i = placements_.size(); i < kFewestValues; ++i) {
      const std::size_t file = i % source_.files.size();
      if (repeated + source_.files[file].size > kMostRepeatedBytes) continue;
      repeated += source_.files[file].size;
      place(file);
    }
    return std::move(placements_);
  }

 private:
  enum Name : std::size_t { Thumbnails, Videos, Drafts, Settings };

  void place(std::size_t file) {
    constexpr std::array turns = {Thumbnails, Videos, Drafts,     Settings, Thumbnails,
                                  Videos,     Drafts, Thumbnails, Videos,   Thumbnails};
    const std::uint64_t size = source_.files[file].size;
    Name name = turns[placements_.size() % turns.size()];
    if (!shelves_[name].hasRoomFor(size)) name = Drafts;
    Shelf& shelf = shelves_[name];
    KeyValueClient::Value value{file};
    if (name == Videos) value.chunkSecond = static_cast<int>(shelf.values) % kSecondsOfAVideo;
    placements_.push_back({shelf.store, shelf.keyPrefix + std::to_string(shelf.values), value});
    shelf.bytes += size;
    ++shelf.values;
  }

  static constexpr std::uint64_t kAnySize = std::numeric_limits<std::uint64_t>::max() / 2;
  static constexpr std::size_t kAnyNumber = std::numeric_limits<std::size_t>::max();

  const SourceFiles& source_;
  std::vector<Placement> placements_;
  std::array<Shelf, 4> shelves_ = {{{"thumbnails", "thumbnail-", 32U << 10U, 24U << 20U, kAnyNumber, 0, 0},
                                    {"videos", "chunk-", 64U << 10U, 24U << 20U, kAnyNumber, 0, 0},
                                    {"drafts", "draft-", kAnySize, kAnySize, kAnyNumber, 0, 0},
                                    {"settings", "setting-", 4U << 10U, kAnySize, 128, 0, 0}}};
};

}  // namespace

std::vector<Placement> placeFiles(const SourceFiles& source) { return Placing(source).all(); }

}  // namespace velmora::mobile::xplat::cellar::tools
