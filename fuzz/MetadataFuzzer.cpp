// Extended metadata: any bytes are a record, what is written reads back, and the order that rests on it is one.

#include <array>
#include <cstdint>
#include <limits>
#include <memory>
#include <string>
#include <vector>

#include "DiskCacheItem.h"
#include "ExtendedMetadata.h"
#include "PruneStrategy.h"
#include "harness/ByteReader.h"
#include "harness/Check.h"
#include "harness/Fuzzing.h"

namespace velmora::mobile::xplat::cellar::fuzz {
namespace {

using Bytes = std::vector<unsigned char>;
using ItemType = VideoDownloadExtendedMetadata::ItemType;

// The values of the first records: what was gathered behind the last ":" since the last "{" and before each "}".
std::vector<std::string> expectedValues(const std::string& bytes, std::size_t count) {
  std::vector<std::string> values;
  for (std::size_t end = bytes.find('}'); end != std::string::npos && values.size() < count;
       end = bytes.find('}', end + 1)) {
    const std::string before = bytes.substr(0, end);
    const std::size_t start = before.find_last_of('{') + 1;  // 0 where there is none
    const std::size_t colon = before.find(':', start);
    std::string value = colon == std::string::npos ? "" : before.substr(colon + 1);
    std::string kept;
    for (const char c : value) {
      if (c != ':' && c != '}') kept.push_back(c);
    }
    values.push_back(kept);
  }
  values.resize(count);
  return values;
}

int expectedNumber(const std::string& text, int otherwise) {
  const char* const space = " \t\n\v\f\r";
  const std::size_t first = text.find_first_not_of(space);
  if (first == std::string::npos) return otherwise;
  std::string digits = text.substr(first, text.find_last_not_of(space) - first + 1);
  const bool negative = digits[0] == '-';
  if (negative || digits[0] == '+') digits.erase(0, 1);
  if (digits.empty() || digits.find_first_not_of("0123456789") != std::string::npos) return otherwise;
  long long number = 0;
  for (const char digit : digits) {
    number = number * 10 + (digit - '0');
    if (number > 3'000'000'000LL) return otherwise;
  }
  if (negative) number = -number;
  const bool fits = number >= std::numeric_limits<int>::min() && number <= std::numeric_limits<int>::max();
  return fits ? static_cast<int>(number) : otherwise;
}

void checkReading(const std::string& bytes) {
  VideoDownloadExtendedMetadata metadata;
  metadata.deserialize(bytesOf(bytes));
  const auto values = expectedValues(bytes, 2);
  check(metadata.getExtendedMetadata() == expectedNumber(values[0], VideoDownloadExtendedMetadata::DefaultChunkSecond),
        "the first value is the second", values[0]);
  check(static_cast<int>(metadata.getItemType()) == expectedNumber(values[1], static_cast<int>(ItemType::Unreadable)),
        "the second value is the type", values[1]);

  const auto four = binaryToValueString<4>(bytesOf(bytes));
  const auto expected = expectedValues(bytes, 4);
  check(std::vector<std::string>(four.begin(), four.end()) == expected, "values come by position");

  const Bytes written = metadata.serialize();
  VideoDownloadExtendedMetadata again;
  again.deserialize(written);
  check(again.getExtendedMetadata() == metadata.getExtendedMetadata() && again.getItemType() == metadata.getItemType(),
        "what is written reads back");
  check(again.serialize() == written, "writing what was read changes nothing");
}

std::string withoutMarks(const std::string& text) {
  std::string kept;
  for (const char c : text) {
    if (c != '{' && c != ':' && c != '}') kept.push_back(c);
  }
  return kept;
}

void checkRecords(ByteReader input) {
  std::array<std::string, 3> values;
  Bytes bytes;
  for (std::string& value : values) {
    const std::string key = withoutMarks(input.text());
    value = withoutMarks(input.text());
    pushKeyValueIntoBinary(key, value, bytes);
  }
  check(binaryToValueString<3>(bytes) == values, "records free of marks read back");
  check(binaryToValueString<1>(bytes)[0] == values[0], "fewer may be asked for than there are");
}

// Restores what the process shares.
class Weights {
 public:
  Weights(int weight, int cutoff) {
    VideoDownloadPruneStrategy::priorityWeight = weight;
    VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = cutoff;
  }
  Weights(const Weights&) = delete;
  Weights& operator=(const Weights&) = delete;
  ~Weights() {
    VideoDownloadPruneStrategy::priorityWeight = 0;
    VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = 0;
  }
};

DiskCacheItem itemFrom(ByteReader& input) {
  DiskCacheItem item;
  item.lastAccessDate = input.integer<std::int32_t>();
  if (input.byte() % 4 == 0) return item;
  const auto second = input.integer<std::int32_t>();
  const auto type = static_cast<ItemType>(static_cast<std::int8_t>(input.byte()));
  item.extendedMetadata = std::make_shared<VideoDownloadExtendedMetadata>(second, type);
  return item;
}

void checkOrder(ByteReader input) {
  const auto weight = input.integer<std::int32_t>();
  const Weights weights(weight, input.integer<std::int32_t>());
  const DiskCacheItem a = itemFrom(input);
  const DiskCacheItem b = itemFrom(input);
  const VideoDownloadPruneStrategy strategy;
  const bool before = strategy.compare(&a, &b);
  check(!(before && strategy.compare(&b, &a)), "of two items only one goes before the other");
  check(!strategy.compare(&a, &a), "no item goes before itself");
  const bool byDate = LRUPruneStrategy().compare(&a, &b);
  check(byDate == (a.lastAccessDate < b.lastAccessDate), "the item used less recently goes first");
  const bool weighs = weight != 0 && a.extendedMetadata != nullptr && b.extendedMetadata != nullptr;
  check(weighs || before == byDate, "without a weight the order is that of use");
}

}  // namespace

void run(const ByteReader& input) {
  checkReading(ByteReader(input).rest());
  checkRecords(input);
  checkOrder(input);
}

}  // namespace velmora::mobile::xplat::cellar::fuzz

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  velmora::mobile::xplat::cellar::fuzz::run({data, size});
  return 0;
}
