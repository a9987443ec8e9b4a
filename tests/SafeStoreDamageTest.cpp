// Random damage to the files of a safe store: what is delivered afterwards is what was stored. CELLAR_DAMAGES sets the
// number of damaged stores of each kind, CELLAR_FIRST_DAMAGE the seed of the first.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstddef>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iostream>
#include <iterator>
#include <map>
#include <memory>
#include <random>
#include <string>
#include <vector>

#include "Durability.h"
#include "LarderException.h"
#include "support/KeyValueStoreFixture.h"
#include "support/LogCapture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::KeyValueStoreFixture;
using test::LogCapture;

std::size_t numberIn(const char* variable, std::size_t usual) {
  const char* const number = std::getenv(variable);
  return number == nullptr ? usual : static_cast<std::size_t>(std::stoul(number));
}

class SafeStoreDamage : public KeyValueStoreFixture, public testing::WithParamInterface<bool> {
 protected:
  using Random = std::mt19937;
  using Values = std::map<std::string, std::string>;

  SafeStoreDamage() {
    options.durability = Durability::Safe;
    options.inlineData = GetParam();
    options.staleAge = 50L * 365 * 86400;
  }

  // Some values, replaced and removed, whose manifest has more than one page.
  Values live(Random& random) {
    Values values;
    open();
    for (int i = 0; i < 60; ++i) {
      const std::string key = "key " + std::to_string(random() % 40);
      if (random() % 6 == 0) {
        drop(key);
        values.erase(key);
      } else {
        values[key] = key + " " + std::to_string(i) + std::string(random() % 300, static_cast<char>('a' + i % 26));
        put(key, values[key]);
      }
    }
    close();
    return values;
  }

  static std::string read(const std::string& path) {
    std::ifstream in(path, std::ios::binary);
    return {std::istreambuf_iterator<char>(in), {}};
  }

  static void write(const std::string& path, const std::string& bytes) {
    std::ofstream(path, std::ios::binary | std::ios::trunc) << bytes;
  }

  // Flips bits, overwrites a range with garbage or zeros, cuts the end off, or puts something else there.
  static void damage(const std::string& path, Random& random) {
    std::string bytes = read(path);
    if (bytes.empty()) bytes = "?";
    const std::size_t at = random() % bytes.size();
    switch (random() % 5) {
      case 0:
        for (std::size_t flips = 1 + random() % 8; flips > 0; --flips) {
          bytes[random() % bytes.size()] ^= static_cast<char>(1U << (random() % 8));
        }
        break;
      case 1:
        for (std::size_t i = at; i < std::min(bytes.size(), at + 1 + random() % 5000); ++i) {
          bytes[i] = static_cast<char>(random());
        }
        break;
      case 2:
        for (std::size_t i = at; i < std::min(bytes.size(), at + 4096); ++i) bytes[i] = 0;
        break;
      case 3:
        bytes.resize(at);
        break;
      default:
        bytes = "Something else altogether.";
    }
    write(path, bytes);
  }

  void damageOne(bool isManifest, const Values& values, Random& random) {
    if (isManifest) return damage(pathOf("manifest_v1.sqlite"), random);
    if (GetParam()) return damageInlineValue(values, random);
    const std::vector<std::string> names = valueFiles();
    ASSERT_THAT(names, testing::SizeIs(values.size()));
    damage(pathOf(names[random() % names.size()]), random);
  }

  // Other bytes in its place; the record knows the length.
  void damageInlineValue(const Values& values, Random& random) {
    const std::string& value = std::next(values.begin(), static_cast<std::ptrdiff_t>(random() % values.size()))->second;
    std::string bytes = read(pathOf("manifest_v1.sqlite"));
    const std::size_t place = bytes.find(value);
    ASSERT_NE(place, std::string::npos) << value;
    const std::size_t first = random() % value.size();
    const std::size_t count = 1 + random() % (value.size() - first);
    for (std::size_t i = first; i < first + count; ++i) bytes[place + i] ^= static_cast<char>(1 + random() % 255);
    write(pathOf("manifest_v1.sqlite"), bytes);
  }

  // The number of values that are delivered. None may be wrong; new work must succeed.
  std::size_t expectNothingWrong(const Values& values) {
    std::size_t delivered = 0;
    for (const bool isReopened : {false, true}) {
      delivered = 0;
      open();
      for (int i = 0; i < 40; ++i) {
        const std::string key = "key " + std::to_string(i);
        const std::string answer = get(key);
        const auto value = values.find(key);
        const bool isRight = value != values.end() && answer == value->second;
        if (isRight) ++delivered;
        EXPECT_TRUE(isRight || answer == "<miss>" || answer.rfind("<error>", 0) == 0)
            << key << " is '" << answer << "'" << (isReopened ? " after another restart" : "");
      }
      put("new", "value");
      EXPECT_EQ(get("new"), "value");
      close();
    }
    return delivered;
  }

  void run(const char* what, bool isManifest) {
    const LogCapture log;
    std::size_t stored = 0;
    std::size_t delivered = 0;
    std::size_t withoutAny = 0;
    const std::size_t damages = numberIn("CELLAR_DAMAGES", 60);
    const std::size_t first = numberIn("CELLAR_FIRST_DAMAGE", 0);
    for (std::size_t seed = first; seed < first + damages && !HasFailure(); ++seed) {
      SCOPED_TRACE(seed);
      Random random(seed);
      const Values values = live(random);
      damageOne(isManifest, values, random);
      const std::size_t kept = expectNothingWrong(values);
      stored += values.size();
      delivered += kept;
      if (kept == 0) ++withoutAny;
      std::filesystem::remove_all(storePath());
      queues = std::make_shared<test::ManualQueueFactory>();  // keeps those of every store that there was
    }
    std::cout << damages << " damaged " << what << ": " << delivered << " of " << stored
              << " values delivered, none in " << withoutAny << " stores\n";
    RecordProperty("delivered", std::to_string(delivered));
  }
};

TEST_P(SafeStoreDamage, OfTheManifestDeliversNothingWrong) { run("manifests", true); }

TEST_P(SafeStoreDamage, OfAValueDeliversNothingWrong) { run("values", false); }

INSTANTIATE_TEST_SUITE_P(Of, SafeStoreDamage, testing::Values(false, true),
                         [](const auto& parameter) { return parameter.param ? "InlineValues" : "Files"; });

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
