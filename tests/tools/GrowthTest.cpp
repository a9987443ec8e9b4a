#include "inspect/Growth.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <sstream>
#include <string>

#include "Console.h"
#include "InputError.h"
#include "inspect/Survey.h"
#include "inspect/SurveyJson.h"
#include "storage/ConfiguredStores.h"
#include "storage/Layout.h"
#include "tools/StoredData.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using test::StoredData;
using testing::HasSubstr;

const std::string kThumbs = "caches/_sessionlessStore/thumbs_v1";
const std::string kWeb = "caches/_sessionlessStore/web_v1";

class Growing : public testing::Test {
 protected:
  Moment look(std::int64_t now = StoredData::kNow) {
    const Survey survey = makeSurvey(findLayout(data_.root()), ConfiguredStores(), 0, now, [](std::uint64_t) {});
    return momentOf(surveyAsJson(survey), "now");
  }

  static std::string textOf(const Growth& growth) {
    std::ostringstream stream;
    Console console(stream, false, false);
    printGrowth(growth, console);
    return stream.str();
  }

  static std::string errorOf(const nlohmann::json& document) {
    try {
      (void)momentOf(document, "old.json");
    } catch (const InputError& error) {
      return error.what();
    }
    return "no error";
  }

  StoredData data_;
};

TEST_F(Growing, NothingHasChangedBetweenTwoEqualMoments) {
  data_.putItem(kThumbs, "a", "one");
  const Growth growth = growthBetween(look(), look(StoredData::kNow + 60));
  EXPECT_TRUE(growth.changes.empty());
  EXPECT_EQ(growth.until - growth.since, 60);
  EXPECT_THAT(textOf(growth), HasSubstr("Since 2023-11-14 22:13:20 UTC\n  nothing has changed\n"));
}

TEST_F(Growing, TheLargestChangeIsFirstAndWhatIsNewOrGoneIsSaid) {
  data_.putItem(kThumbs, "a", "one");
  data_.putFile(kWeb + "/page.html", std::string(100, 'p'));
  data_.putFile("caches/_sessionlessStore/trash/1/left", std::string(5, 't'));
  const Moment before = look();
  data_.putItem(kThumbs, "b", "seven");
  std::filesystem::remove_all(data_.path(kWeb));
  data_.putFile("caches/_sessionlessStore/new_v1/video", std::string(1'000'000, 'v'));
  const Growth growth = growthBetween(before, look());

  ASSERT_EQ(growth.changes.size(), 3U);
  EXPECT_EQ(growth.changes[0].path, "caches/_sessionlessStore/new_v1");
  EXPECT_FALSE(growth.changes[0].before);
  EXPECT_EQ(growth.changes[0].after->heldBytes, 1'000'000U);
  const std::string text = textOf(growth);
  EXPECT_THAT(text, testing::ContainsRegex("new_v1 +\\+1 +\\+976\\.6 KB .* new\n"));
  EXPECT_THAT(text, testing::ContainsRegex("web_v1 +-1 +-100 B .* gone\n"));
  EXPECT_THAT(text, testing::ContainsRegex("thumbs_v1 +\\+1 +\\+5 B "));
  EXPECT_THAT(text, testing::ContainsRegex("all together +\\+1 "));

  const nlohmann::json json = growthAsJson(growth);
  EXPECT_EQ(json.at("since"), StoredData::kNow);
  EXPECT_EQ(json.at("parts").at(0).at("before"), nullptr);
  EXPECT_EQ(json.at("parts").at(0).at("after").at("items"), 1);
}

TEST_F(Growing, AnEmptyStorageHasGrownFromNothing) {
  std::filesystem::create_directories(data_.root());
  const Moment before = look();
  data_.putItem(kThumbs, "a", "one");
  EXPECT_EQ(growthBetween(before, look()).changes.size(), 1U);
}

TEST_F(Growing, PartsOfAStorageAreNotComparedWithAll) {
  data_.putItem(kThumbs, "a", "one");
  Moment store = look();
  store.depth = "store";
  EXPECT_THROW((void)growthBetween(store, look()), InputError);
  EXPECT_THROW((void)growthBetween(look(), store), InputError);
}

TEST_F(Growing, OtherDocumentsAreRefusedWithThePlace) {
  data_.putItem(kThumbs, "a", "one");
  const nlohmann::json sound =
      surveyAsJson(makeSurvey(findLayout(data_.root()), ConfiguredStores(), 0, StoredData::kNow, [](std::uint64_t) {}));
  EXPECT_EQ(errorOf(sound), "no error");
  nlohmann::json large = sound;  // as a sparse file makes it
  large["managers"][0]["stores"][0]["held_bytes"] = (1ULL << 63U) - 1;
  EXPECT_EQ(errorOf(large), "no error");
  EXPECT_EQ(errorOf(nlohmann::json::array()), "old.json: is not an object");
  EXPECT_EQ(errorOf({{"inspected_at", 1}}), "old.json: has no 'depth'");

  const auto changed = [&](const char* pointer, const nlohmann::json& value) {
    nlohmann::json document = sound;
    document[nlohmann::json::json_pointer(pointer)] = value;
    return errorOf(document);
  };
  EXPECT_EQ(changed("/managers", nullptr), "old.json: /managers: is not an array");
  EXPECT_EQ(changed("/managers/0/stores", "x"), "old.json: /managers/0/stores: is not an array");
  EXPECT_EQ(changed("/managers/0/stores/0", 1), "old.json: /managers/0/stores/0: is not an object");
  EXPECT_EQ(changed("/managers/0/stores/0/path", 1), "old.json: /managers/0/stores/0/path: is not a text");
  for (const nlohmann::json& value : {nlohmann::json(-1), nlohmann::json(1.5), nlohmann::json(1ULL << 63U)}) {
    EXPECT_EQ(changed("/managers/0/stores/0/items", value),
              "old.json: /managers/0/stores/0/items: is not a whole number from 0 to 9223372036854775807");
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
