#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <filesystem>
#include <nlohmann/json.hpp>
#include <sstream>
#include <string>
#include <vector>

#include "AttributeStore.h"
#include "Console.h"
#include "DiskSizeCalculator.h"
#include "FileUtils.h"
#include "InputError.h"
#include "inspect/Survey.h"
#include "inspect/SurveyJson.h"
#include "inspect/SurveyText.h"
#include "storage/ConfiguredStores.h"
#include "storage/FileSystemSize.h"
#include "storage/Layout.h"
#include "support/Watchdog.h"
#include "tools/StoredData.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using test::StoredData;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::Not;
using testing::UnorderedElementsAre;

constexpr std::int32_t kDay = 86400;
const std::string kThumbs = "caches/_sessionlessStore/thumbs_250_v1";
const std::string kDrafts = "documents/_store_alice/drafts_v1";
const std::string kWeb = "caches/_sessionlessStore/web_250_v1";

const char* const kConfiguration = R"({
  "media": { "area": "caches", "session_scoped": false, "max_size": "1KB", "prune_interval": "1 hours", "stores": {
    "thumbs": { "type": "disk_cache", "lru_size_limit": "100B", "survival_size": "50B", "stale_age": "30 days" },
    "web": { "type": "unmanaged", "is_cache": true, "max_size": "400B" } } },
  "user": { "area": "documents", "session_scoped": true, "stores": {
    "drafts": { "type": "pkvs", "has_version": true, "inline_data": true, "capacity": 4, "stale_age": "1 years" } } }
})";

class Inspecting : public testing::Test {
 protected:
  void makeRoot() {
    data_.putItem(kThumbs, "old", std::string(80, 'o'), 40 * kDay);
    data_.putItem(kThumbs, "young", std::string(30, 'y'), 60);
    data_.putItem(kThumbs, "middle", std::string(50, 'm'), 2 * kDay);
    data_.putInline(kDrafts, "letter", "dear", 3600);
    data_.putFile(kWeb + "/deep/page.html", std::string(200, 'h'));
    std::filesystem::create_directories(data_.path("caches/_sessionlessStore/tmp"));
  }

  Survey look(const std::string& below = "") {
    return makeSurvey(findLayout(data_.path(below)), configured_, 2, StoredData::kNow, [](std::uint64_t) {});
  }

  nlohmann::ordered_json json() { return surveyAsJson(look()); }

  static const StoreSurvey& storeIn(const Survey& survey, const std::string& path) {
    for (const ManagerSurvey& manager : survey.managers) {
      for (const StoreSurvey& store : manager.stores) {
        if (store.path == path) return store;
      }
    }
    throw std::out_of_range(path);
  }

  void configure() { configured_ = ConfiguredStores(data_.directory().write("configuration.json", kConfiguration)); }

  static std::vector<std::string> keysOf(const std::vector<ItemFigures>& items) {
    std::vector<std::string> keys;
    for (const ItemFigures& item : items) keys.push_back(item.key);
    return keys;
  }

  // "path kind"
  static std::vector<std::string> leftoversOf(const Survey& survey) {
    std::vector<std::string> lines;
    for (const Leftover& leftover : survey.leftovers) lines.push_back(leftover.path + " " + textOf(leftover.kind));
    return lines;
  }

  std::string text() {
    std::ostringstream stream;
    Console console(stream, false, false);
    printSurvey(look(), console);
    return stream.str();
  }

  StoredData data_;
  ConfiguredStores configured_;
};

TEST_F(Inspecting, ChangesNoByteAndNoDateOfAnything) {
  makeRoot();
  data_.killWhileWriting(kThumbs, "half-written");
  data_.putFile(kWeb + "/_cellar_extended_attributes", "{\"qzDirectorySizeCalculationSize\":7}");
  data_.makeReadingVisible();
  configure();
  const auto before = data_.trace();
  EXPECT_EQ(storeIn(look(), kThumbs).items, 4U);
  EXPECT_THAT(text(), HasSubstr("thumbs_250_v1"));
  EXPECT_EQ(data_.trace(), before);
}

TEST_F(Inspecting, CountsItemsAndBytesAsRecordedHeldAndAllocated) {
  makeRoot();
  data_.putRecord(kThumbs, {"lost", "lost", 7, false, StoredData::kNow, StoredData::kNow, nullptr});
  const Survey survey = look();
  const StoreSurvey& thumbs = storeIn(survey, kThumbs);
  EXPECT_EQ(thumbs.kind, StoreKind::Keyed);
  EXPECT_EQ(thumbs.items, 4U);
  EXPECT_EQ(thumbs.recordedBytes, 167U);
  EXPECT_EQ(thumbs.files, 3U);
  EXPECT_EQ(thumbs.fileBytes, 160U);
  EXPECT_GT(thumbs.manifestBytes, 4096U);
  EXPECT_GE(thumbs.allocatedBytes, thumbs.manifestBytes);
  const StoreSurvey& drafts = storeIn(survey, kDrafts);
  EXPECT_EQ(drafts.files, 0U);
  EXPECT_EQ(drafts.inlineBytes, 4U);
  EXPECT_EQ(drafts.recordedBytes, 4U);
}

TEST_F(Inspecting, MeasuresAnUnmanagedStoreAndReadsTheSizeThatWasKept) {
  makeRoot();
  EXPECT_EQ(storeIn(look(), kWeb).recordedBytes, std::nullopt);
  data_.putFile(kWeb + "/_cellar_extended_attributes", "{\"qzDirectorySizeCalculationSize\":7}");
  const Survey survey = look();
  const StoreSurvey& web = storeIn(survey, kWeb);
  EXPECT_EQ(web.kind, StoreKind::Unmanaged);
  EXPECT_EQ(web.recordedBytes, 7U);
  EXPECT_EQ(web.fileBytes, 200U);
  EXPECT_EQ(web.items, 1U);
  EXPECT_THAT(keysOf(web.largest), ElementsAre("deep/page.html"));
}

TEST_F(Inspecting, NamesTheLargestAndWhatGoesFirstUpToTop) {
  makeRoot();
  const Survey survey = look();
  EXPECT_THAT(keysOf(storeIn(survey, kThumbs).largest), ElementsAre("old", "middle"));
  EXPECT_THAT(keysOf(storeIn(survey, kThumbs).nextToGo), ElementsAre("old", "middle"));
  EXPECT_EQ(storeIn(survey, kThumbs).itemsToPrune, std::nullopt);
  EXPECT_EQ(storeIn(survey, kThumbs).oldestAccess, StoredData::kNow - 40 * kDay);
  EXPECT_EQ(storeIn(survey, kThumbs).newestAccess, StoredData::kNow - 60);
}

TEST_F(Inspecting, ListsWhatGoesNextByTheConfiguredStrategyAndSaysWhy) {
  const auto useStrategy = [&](const std::string& strategy) {
    configured_ = ConfiguredStores(data_.directory().write(
        "configuration.json", R"({"m": {"session_scoped": false, "stores": {"thumbs": {"type": "disk_cache",
                                 "lru_size_limit": "1KB", "prune_strategy": ")" +
                                  strategy + R"("}}}})"));
  };
  data_.putItem(kThumbs, "small and old", "s", 3 * kDay);
  data_.putItem(kThumbs, "large", std::string(100000, 'l'), 2 * kDay);
  data_.putItem(kThumbs, "small and new", "s", kDay);
  EXPECT_THAT(text(), HasSubstr("thumbs_250_v1, next to be evicted by lru, as no configuration says otherwise:"));
  for (const char* const strategy : {"lru", "null", "video_download"}) {
    useStrategy(strategy);
    EXPECT_THAT(keysOf(storeIn(look(), kThumbs).nextToGo), ElementsAre("small and old", "large")) << strategy;
    EXPECT_THAT(text(), HasSubstr("3 days; the least recently used of those left")) << strategy;
  }
  useStrategy("greedy_dual");
  const Survey survey = look();
  const StoreSurvey& thumbs = storeIn(survey, kThumbs);
  EXPECT_THAT(keysOf(thumbs.nextToGo), ElementsAre("large", "small and old"));
  EXPECT_EQ(thumbs.nextToGo.front().reason, "its size: smaller ones that were used less recently stay longer");
  EXPECT_EQ(thumbs.itemsToPrune, 1U);
  EXPECT_EQ(thumbs.order, "greedy_dual");
  EXPECT_THAT(text(), HasSubstr("thumbs_250_v1, next to be evicted by greedy_dual, as after a restart (a prune would"));
  EXPECT_EQ(json()["managers"][0]["stores"][0]["next_to_go"][1]["reason"], "the least recently used of those left");
}

TEST_F(Inspecting, ListsEveryItemEvenThoseWithoutASize) {
  for (const char* const key : {"a", "b", "c"}) data_.putItem(kThumbs, key, "");
  EXPECT_EQ(storeIn(look(), kThumbs).nextToGo.size(), 2U);
}

TEST_F(Inspecting, KnowsLimitsAndWhatIsStaleFromTheConfiguration) {
  makeRoot();
  configure();
  const Survey survey = look();
  const StoreSurvey& thumbs = storeIn(survey, kThumbs);
  EXPECT_EQ(thumbs.kind, StoreKind::DiskCache);
  EXPECT_EQ(thumbs.identifier, "thumbs");
  EXPECT_EQ(thumbs.limitBytes, 100U);
  EXPECT_EQ(thumbs.survivalBytes, 50U);
  EXPECT_EQ(thumbs.staleItems, 1U);
  EXPECT_EQ(thumbs.staleBytes, 80U);
  EXPECT_EQ(thumbs.itemsToPrune, 1U);  // 160 bytes, of which the oldest 80 bring it below 100
  EXPECT_EQ(thumbs.bytesToPrune, 80U);
  EXPECT_EQ(storeIn(survey, kDrafts).capacity, 4U);
  EXPECT_EQ(storeIn(survey, kWeb).limitBytes, 400U);
  EXPECT_EQ(survey.managers.at(0).name, "media");
  EXPECT_EQ(survey.managers.at(0).limitBytes, 1024U);
  EXPECT_EQ(survey.managers.at(0).countedBytes, 360U);  // 160 recorded, and 200 measured
  EXPECT_EQ(survey.managers.at(0).unmanagedBytes, 200U);
  EXPECT_THAT(survey.leftovers, IsEmpty());
}

TEST_F(Inspecting, SaysHowFullThingsAre) {
  makeRoot();
  configure();
  const auto document = json();
  const auto& media = document["managers"][0];
  EXPECT_EQ(media["fill"], 0.3516);
  EXPECT_EQ(media["stores"][0]["fill"], 1.6);
  EXPECT_EQ(media["stores"][1]["fill"], 0.5);
  EXPECT_EQ(document["managers"][1]["stores"][0]["fill"], 0.25);
}

// An application counts what it has measured; what it knew is not on the disk, only what it once kept.
TEST_F(Inspecting, CountsWhatMeasuringAnUnmanagedStoreFindsForTheLimitOfItsManager) {
  makeRoot();
  configure();
  data_.putFile(kWeb + "/_cellar_extended_attributes", "{\"qzDirectorySizeCalculationSize\":7}");
  EXPECT_THAT(text(), HasSubstr("media, 360 B of 1.0 KB (35 %), of which 200 B measured now in unmanaged stores\n"));
  data_.putFile("caches/_sessionlessStore/web_250_v0/page", "of another version, which does not count");
  EXPECT_EQ(look().managers.at(0).countedBytes, 360U);
  DiskSizeCalculator calculator(std::make_shared<FileUtils>(),
                                std::make_shared<AttributeStore>(std::make_shared<FileUtils>()), nullptr);
  calculator.exclude(AttributeStore::fileName);
  std::filesystem::remove(data_.path(kWeb + "/_cellar_extended_attributes"));
  EXPECT_EQ(calculator.calculateDirectorySize(data_.path(kWeb)).size, 200);
}

TEST_F(Inspecting, WithoutAConfigurationTakesTheLowerVersionOfANameForALeftover) {
  data_.makeStore("caches/_sessionlessStore/thumbs_v9");
  data_.makeStore("caches/_sessionlessStore/thumbs_v10");
  data_.makeStore("caches/_sessionlessStore/other_v1");
  EXPECT_THAT(leftoversOf(look()), ElementsAre("caches/_sessionlessStore/thumbs_v9 other_version"));
}

TEST_F(Inspecting, WithAConfigurationTakesOtherVersionsOlderTagsAndUnknownNamesForLeftovers) {
  makeRoot();
  configure();
  data_.putItem("caches/_sessionlessStore/thumbs_249_v1", "older", "x", 50 * kDay);
  data_.putItem("documents/_store_alice/drafts_v2", "another", "x");
  data_.putFile("documents/_store_alice/forgotten/file", "x");
  EXPECT_THAT(leftoversOf(look()), UnorderedElementsAre("caches/_sessionlessStore/thumbs_249_v1 other_version",
                                                        "documents/_store_alice/drafts_v2 other_version",
                                                        "documents/_store_alice/forgotten not_configured"));
}

TEST_F(Inspecting, TakesAllSessionsButTheOneUsedLastForLeftovers) {
  makeRoot();
  data_.putItem("documents/_store_bob/drafts_v1", "letter", "x", 9 * kDay);
  EXPECT_THAT(leftoversOf(look()), ElementsAre("documents/_store_bob/drafts_v1 other_session"));
}

TEST_F(Inspecting, FindsTemporaryFilesTrashAndQuarantine) {
  makeRoot();
  EXPECT_THAT(leftoversOf(look()), IsEmpty());
  data_.putFile("caches/_sessionlessStore/tmp/half", "12345");
  data_.putFile("trash/0123/deep/file", "123");
  data_.putFile("documents/_cellar_quarantine/_store_alice/drafts_v1/stray", "1");
  const Survey survey = look();
  EXPECT_THAT(leftoversOf(survey), UnorderedElementsAre("caches/_sessionlessStore/tmp temporary", "trash trash",
                                                        "documents/_cellar_quarantine quarantine"));
  const auto document = surveyAsJson(survey);
  EXPECT_EQ(document["totals"]["leftover_bytes"], 9);
  EXPECT_EQ(document["totals"]["stores"], 3);
}

TEST_F(Inspecting, KeepsManagersApartWhoseAreasHaveNamesOfTheHostsOwn) {
  configured_ = ConfiguredStores(data_.directory().write("configuration.json", R"({
    "media": { "max_size": "1KB", "stores": { "thumbs": { "type": "disk_cache" }, "twin": { "type": "pkvs" } } },
    "user": { "area": "documents", "max_size": "2KB", "stores": {
      "drafts": { "type": "pkvs", "has_version": true }, "twin_": { "type": "pkvs", "name": "twin" } } },
    "other": { "area": "shared", "max_size": "4KB" } })"));
  data_.putItem("Library/_store_alice/thumbs_250_v1", "a", "x");
  data_.putItem("Support/_store_alice/drafts_v1", "a", "x");
  data_.putItem("Support/_store_alice/twin_250_v1", "a", "x");
  data_.putItem("Unclear/_store_alice/twin_250_v1", "a", "x");
  const Survey survey = look();
  ASSERT_EQ(survey.managers.size(), 3U);
  EXPECT_EQ(survey.managers.at(0).name, "media");
  EXPECT_EQ(survey.managers.at(0).limitBytes, 1024U);
  EXPECT_EQ(survey.managers.at(1).name, "user");
  EXPECT_EQ(survey.managers.at(1).limitBytes, 2048U);
  EXPECT_EQ(storeIn(survey, "Support/_store_alice/twin_250_v1").identifier, "twin_");
  EXPECT_EQ(survey.managers.at(2).name, "media or user");
  EXPECT_EQ(survey.managers.at(2).limitBytes, std::nullopt);
  EXPECT_THAT(leftoversOf(survey), IsEmpty());
}

TEST_F(Inspecting, SortsAgesAndSizesIntoBuckets) {
  makeRoot();
  const auto document = json();
  std::vector<std::string> ages;
  for (const auto& bucket : document["ages"]) {
    if (bucket["items"] > 0) ages.push_back(bucket["label"].get<std::string>() + ": " + bucket["bytes"].dump());
  }
  // The page is as old as this test.
  EXPECT_THAT(ages, ElementsAre("< 1 hour: 230", "< 1 day: 4", "< 1 week: 50", "< 90 days: 80"));
  EXPECT_EQ(document["sizes"][0]["items"], 5);
}

TEST_F(Inspecting, GoesOnBesideADamagedManifest) {
  makeRoot();
  data_.putFile(kThumbs + "/manifest_v1.sqlite", std::string(5000, 'x'));
  const Survey survey = look();
  const StoreSurvey& thumbs = storeIn(survey, kThumbs);
  EXPECT_THAT(thumbs.damages, Not(IsEmpty()));
  EXPECT_EQ(thumbs.recordedBytes, std::nullopt);
  EXPECT_EQ(thumbs.fileBytes, 160U);
  EXPECT_EQ(storeIn(survey, kDrafts).items, 1U);
  EXPECT_THAT(text(), HasSubstr("thumbs_250_v1: the manifest is damaged: "));
}

TEST_F(Inspecting, WaitsForNoFifoInThePlaceOfAttributesOrALog) {
  const test::Watchdog watchdog(60);
  makeRoot();
  ASSERT_EQ(mkfifo(data_.path(kWeb + "/_cellar_extended_attributes").c_str(), 0600), 0);
  EXPECT_EQ(storeIn(look(), kWeb).recordedBytes, std::nullopt);
  const std::string log = data_.path(kThumbs + "/manifest_v1.sqlite-wal");
  std::filesystem::remove(log);
  ASSERT_EQ(mkfifo(log.c_str(), 0600), 0);
  const Survey survey = look();
  ASSERT_EQ(survey.unreadable.size(), 2U);
  EXPECT_EQ(survey.unreadable.front().path, kThumbs + "/manifest_v1.sqlite-wal");
  EXPECT_EQ(survey.unreadable.back().path, kWeb + "/_cellar_extended_attributes");
  EXPECT_EQ(storeIn(survey, kThumbs).files, 3U);
}

TEST_F(Inspecting, KeepsKeysOfAnyBytesInTheirPlace) {
  data_.putItem(kThumbs, "line\nbreak\x1b[2J", "x");
  EXPECT_THAT(text(), HasSubstr("line\\x0abreak\\x1b[2J"));
  data_.putItem(kThumbs, "\xff\xfe", "x");
  EXPECT_NO_THROW((void)json().dump(2, ' ', false, nlohmann::ordered_json::error_handler_t::replace));
}

TEST_F(Inspecting, ShowsEncodedNamesDecodedAndHarmless) {
  data_.putItem("documents/_store_%41l%1b/drafts_v1", "%41nna.txt", "x");
  EXPECT_THAT(text(), HasSubstr("\ndocuments/_store_%41l%1b (session 'Al\\x1b')\n"));
  EXPECT_THAT(text(), HasSubstr("%41nna.txt ('Anna.txt')"));
  EXPECT_EQ(json()["managers"][0]["session"], "%41l%1b");
  EXPECT_EQ(json()["managers"][0]["session_name"], "Al\x1b");
}

// A file system of any size.
class SizedFiles : public FileUtils {
 public:
  explicit SizedFiles(long long total) : total_(total) {}
  DiskSpace getDiskSpace(const std::string& /*path*/) override { return {total_, 0}; }

 private:
  const long long total_;
};

TEST_F(Inspecting, SaysWhenTheFileSystemIsSoSmallThatAllIsDiscardedAtEachStart) {
  makeRoot();
  const auto shown = [&](long long total) {
    SizedFiles files(total);
    Survey survey = look();
    survey.fileSystemBytes = fileSystemSize(data_.root(), files);
    std::ostringstream stream;
    Console console(stream, false, false);
    printSurvey(survey, console);
    return stream.str() + surveyAsJson(survey)["discarded_at_start"].dump();
  };
  constexpr long long kLimit = 75LL << 20;
  EXPECT_THAT(shown(kLimit - 1),
              HasSubstr("the whole file system has 75.0 MB, less than 75.0 MB: at every start, managers discard all"));
  EXPECT_THAT(shown(kLimit - 1), testing::EndsWith("true"));
  EXPECT_THAT(shown(kLimit), Not(HasSubstr("file system")));
  EXPECT_THAT(shown(kLimit), testing::EndsWith("false"));
  FileUtils real;
  EXPECT_THROW(fileSystemSize(data_.path("missing"), real), InputError);
}

TEST_F(Inspecting, PrintsJsonWhoseKeysAreFrozen) {
  makeRoot();
  const auto document = json();
  const auto keysOf = [](const nlohmann::ordered_json& object) {
    std::string keys;
    for (const auto& member : object.items()) keys += member.key() + " ";
    return keys;
  };
  EXPECT_EQ(
      keysOf(document),
      "root depth inspected_at totals managers leftovers ages sizes unreadable file_system_bytes discarded_at_start ");
  EXPECT_EQ(keysOf(document["totals"]),
            "stores items held_bytes manifest_bytes allocated_bytes leftover_bytes leftover_allocated_bytes ");
  EXPECT_EQ(keysOf(document["managers"][0]),
            "path directory name area session limit_bytes counted_bytes fill stores session_name unmanaged_bytes ");
  EXPECT_EQ(
      keysOf(document["managers"][0]["stores"][0]),
      "path directory identifier kind leftover damages items recorded_bytes files file_bytes inline_bytes "
      "held_bytes manifest_bytes allocated_bytes limit_bytes survival_bytes capacity stale_age fill oldest_access "
      "newest_access stale_items stale_bytes items_to_prune bytes_to_prune next_to_go largest ages sizes durability "
      "quarantined_files quarantined_bytes eviction_order eviction_order_configured ");
  EXPECT_EQ(keysOf(document["managers"][0]["stores"][0]["largest"][0]), "key bytes last_access inline ");
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
