// The attributes document and the sizes that are kept in it: any bytes are read without a failure, a damaged document
// counts as none, and measuring mends it.

#include <cmath>
#include <cstdint>
#include <ctime>
#include <limits>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "AttributeStore.h"
#include "DiskSizeCalculator.h"
#include "FileUtils.h"
#include "JsonValue.h"
#include "harness/ByteReader.h"
#include "harness/Check.h"
#include "harness/Fuzzing.h"
#include "harness/Scratch.h"
#include "host/testing/ManualClock.h"

namespace velmora::mobile::xplat::cellar::fuzz {
namespace {

using Stats = DiskSizeCalculator::Stats;

constexpr std::time_t kNow = 1'700'000'000;

struct Services {
  std::shared_ptr<FileUtils> files = std::make_shared<FileUtils>();
  std::shared_ptr<AttributeStore> attributes = std::make_shared<AttributeStore>(files);
  DiskSizeCalculator sizes{files, attributes, nullptr};
};

std::optional<std::int64_t> integerIn(const JsonValue& document, const std::string& key) {
  if (!document.contains(key)) return 0;
  if (!document.at(key).is_number_integer()) return std::nullopt;
  return document.at(key).get<std::int64_t>();
}

// The kept figures while they are fresh; nothing when they are old, damaged or missing.
std::optional<Stats> expectedStats(const JsonValue& document, long interval) {
  if (!document.is_object() || document.empty()) return std::nullopt;
  const auto time = integerIn(document, DiskSizeCalculator::ATTR_TIME_STAMP);
  const auto count = integerIn(document, DiskSizeCalculator::ATTR_FILE_COUNT);
  const auto size = integerIn(document, DiskSizeCalculator::ATTR_SIZE);
  const JsonValue spent = document.value(DiskSizeCalculator::ATTR_TIME_SPENT, JsonValue(0.0));
  if (!time || !count || !size || !spent.is_number()) return std::nullopt;
  if (*time <= 0 || *time < kNow - interval) return std::nullopt;
  return Stats(true, spent.get<double>(), *count, *size);
}

bool equal(const Stats& a, const Stats& b) {
  return a.valid == b.valid && a.timeSpent == b.timeSpent && a.fileCount == b.fileCount && a.size == b.size;
}

JsonValue checkReading(Services& services, const std::string& directory, const std::string& bytes) {
  JsonValue document = services.attributes->get(directory);
  const JsonValue expected = JsonValue::accept(bytes) ? JsonValue::parse(bytes) : JsonValue::object();
  check(document == expected, "a document reads as what it is, a damaged one as none");
  services.attributes->set(directory, document);
  check(services.attributes->get(directory) == document, "a document that is set reads back");
  return document;
}

void checkKeptStats(Services& services, const std::string& directory, const JsonValue& document) {
  for (const long interval : {0L, 1L, static_cast<long>(DiskSizeCalculator::STALE_INTERVAL)}) {
    const Stats kept = services.sizes.getCachedStats(directory, interval);
    const Stats expected = expectedStats(document, interval).value_or(Stats(false, 0, 0, 0));
    check(equal(kept, expected), "kept figures count while they are whole and fresh", document.dump());
  }
  const auto size = document.is_object() ? integerIn(document, DiskSizeCalculator::ATTR_SIZE) : 0;
  check(services.sizes.fetchDirectorySize(directory) == size.value_or(0), "the size kept is the document's");
}

// Above the directory lies one that was never measured; what is kept below counts as it stands.
void checkMeasuring(Services& services, const std::string& above, const std::string& directory,
                    const std::string& bytes, const JsonValue& document) {
  const auto kept = expectedStats(document, DiskSizeCalculator::STALE_INTERVAL);
  const Stats measured = services.sizes.calculateDirectorySize(directory);
  if (kept) {
    check(equal(measured, *kept), "fresh figures are not measured again");
  } else {
    check(!measured.valid && measured.fileCount == 2 && measured.timeSpent >= 2e-9, "everything is counted");
    check(measured.size == 5 + static_cast<long long>(bytes.size()), "every byte is counted");
  }
  const auto twice = static_cast<long long>(2 * static_cast<unsigned long long>(measured.size));
  services.attributes->set(above + "/b", services.attributes->get(directory));
  const Stats all = services.sizes.calculateDirectorySize(above);
  check(!all.valid && all.size == twice, "a tree is the sum of its parts", document.dump());
  check(services.sizes.fetchDirectorySize(above) == all.size, "what was measured is kept");
  // JSON has no number for a time that has grown beyond all bounds, which only a damaged document brings about.
  check(services.sizes.getCachedStats(above, 0).valid == std::isfinite(all.timeSpent), "what was measured is fresh");
}

void run(const std::string& bytes) {
  const test::ManualClock clock(kNow);
  const Scratch scratch;
  Services services;
  const std::string above = scratch.makeDirectory("above");
  const std::string directory = scratch.makeDirectory("above/a");
  scratch.makeDirectory("above/b");
  scratch.write("above/a/value", "value");
  scratch.write("above/a/" + AttributeStore::fileName, bytes);

  const JsonValue document = checkReading(services, directory, bytes);
  checkKeptStats(services, directory, document);
  checkMeasuring(services, above, directory, document.dump(), document);
  services.attributes->remove(directory);
  check(services.attributes->get(directory) == JsonValue::object(), "what was removed is gone");
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::fuzz

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  velmora::mobile::xplat::cellar::fuzz::run(std::string(data, data + size));
  return 0;
}
