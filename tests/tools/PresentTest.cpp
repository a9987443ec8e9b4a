#include "tune/Present.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <fstream>
#include <optional>
#include <string>

#include "InputError.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

class PresentTest : public testing::Test {
 protected:
  TuneSettings configured(const std::string& members) {
    const std::string file = directory.file("storage.json");
    std::ofstream(file) << R"({"media":{"stores":{"thumbs":{"type":"disk_cache")" << members << "}}}}";
    return configuredSettings(file, "thumbs");
  }

  // Empty if it is an error.
  std::optional<std::int64_t> configuredLimit(const std::string& text) {
    try {
      return configured(R"(,"lru_size_limit":")" + text + '"').present;
    } catch (const InputError&) {
      return std::nullopt;
    }
  }
  static std::optional<std::int64_t> givenLimit(const std::string& text) {
    try {
      return parseLimit(text);
    } catch (const InputError&) {
      return std::nullopt;
    }
  }

  test::TemporaryDirectory directory;
};

TEST_F(PresentTest, ALimitIsWhatItIsInAConfiguration) {
  for (const char* text : {"50MB", "50 MB", "1B", "007KB", "3GB", "4095MB", "4294967295B"}) {
    ASSERT_TRUE(givenLimit(text).has_value()) << text;
    EXPECT_EQ(givenLimit(text), configuredLimit(text)) << text;
  }
  for (const char* text : {"", "MB", "1.5MB", "20mb", "5MB,", "5MBs", "0MB", "4GB"}) {
    EXPECT_EQ(configuredLimit(text), std::nullopt) << text;
    EXPECT_EQ(givenLimit(text), std::nullopt) << text;
  }
}

TEST_F(PresentTest, ALimitIsNeverTakenForOneThatIsNotMeant) {
  EXPECT_EQ(givenLimit("52428800"), 52428800);  // without a unit; an error in a configuration
  EXPECT_EQ(configuredLimit("5GB"), std::int64_t{1} << 30);
  EXPECT_EQ(configuredLimit("5MB and more"), 5 << 20);
  for (const char* text : {"5GB", "-1B", "5MB and more", "99999999999999999999B"}) {
    EXPECT_EQ(givenLimit(text), std::nullopt) << text;
  }
}

TEST_F(PresentTest, TheStrategyIsTheConfiguredOne) {
  const auto strategy = [&](const std::string& member) {
    return configured(R"(,"lru_size_limit":"5MB")" + member).strategy;
  };
  EXPECT_EQ(strategy(""), "lru");
  EXPECT_EQ(strategy(R"(,"prune_strategy":"lru")"), "lru");
  EXPECT_EQ(strategy(R"(,"prune_strategy":"greedy_dual")"), "greedy_dual");
  EXPECT_EQ(strategy(R"(,"prune_strategy":"video_download")"), "video_download");
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
