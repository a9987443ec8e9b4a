#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <csignal>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include <cellar/SQLiteManifestPersistence.h>

#include "StopSignals.h"
#include "storage/ConfiguredStores.h"
#include "storage/Layout.h"
#include "tools/StoredData.h"
#include "verify/Verification.h"
#include "verify/VerificationJson.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using test::StoredData;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::UnorderedElementsAre;

namespace fs = std::filesystem;

const std::string kManager = "caches/_sessionlessStore";
const std::string kThumbs = kManager + "/thumbs_v1";
const std::string kInline = kManager + "/settings_v1";
const std::string kQuarantined = "caches/_cellar_quarantine/_sessionlessStore/thumbs_v1";

class Verifying : public testing::Test {
 protected:
  // The findings below `root`, without the name of the store.
  std::vector<std::string> findings(const std::string& below = "", bool repair = false) {
    std::vector<std::string> lines;
    result_ = verify(
        findLayout(data_.path(below)), repair, [](std::uint64_t) {},
        [&](const std::string& line) { lines.push_back(line.substr(line.find(": ") + 2)); });
    EXPECT_EQ(result_.findings, lines.size());
    return lines;
  }

  std::vector<std::string> repairs(const std::string& below = "") { return findings(below, true); }

  // As the store itself writes it.
  void record(const std::string& key, std::uint32_t size) {
    data_.putRecord(kThumbs, {key, key, size, false, StoredData::kNow, StoredData::kNow, nullptr});
  }

  // As a safe store writes it, but for the checksum, which is another one.
  void recordWithChecksum(const std::string& key, const std::string& value) {
    const std::string name = key + ".1.00000000";
    DiskCacheItem item(key, name, static_cast<std::uint32_t>(value.size()), false, 1, 1, nullptr);
    item.checksum = 0;
    const std::string path = data_.path(kInline + "/manifest_v1.sqlite");
    data_.makeStore(kInline);
    SQLiteManifestPersistence(path, nullptr, nullptr, Durability::Safe).storeItem(item, nullptr);
    data_.putFile(kInline + "/" + name, value);
  }

  std::string contentOf(const std::string& below) const { return data_.directory().read("root/" + below); }
  bool exists(const std::string& below) const { return data_.directory().exists("root/" + below); }

  StoredData data_;
  VerificationResult result_;
};

TEST_F(Verifying, FindsNothingInSoundStores) {
  data_.putItem(kThumbs, "a", "value");
  data_.putItem(kThumbs, "empty", "");
  data_.putInline(kInline, "b", "inline");
  data_.putInline(kInline, "nothing", "");
  data_.putFile(kThumbs + "/_cellar_extended_attributes", "{}");
  data_.putFile(kManager + "/web_v1/page", "not a store with keys");
  data_.killWhileWriting(kThumbs, "empty");
  EXPECT_THAT(findings(), IsEmpty());
  EXPECT_EQ(result_.stores, 3U);
}

TEST_F(Verifying, ChangesNothingWithoutRepair) {
  data_.putItem(kThumbs, "a", "value");
  data_.putFile(kThumbs + "/stray", "x");
  record("lost", 4);
  data_.killWhileWriting(kThumbs, "half");
  data_.putFile(kManager + "/web_v1/_cellar_extended_attributes", "{");
  recordWithChecksum("damaged", "value");
  data_.makeReadingVisible();
  const auto before = data_.trace();
  EXPECT_EQ(findings().size(), 5U);
  EXPECT_EQ(data_.trace(), before);
  EXPECT_THAT(findings(kInline), ElementsAre("damaged value: 'damaged' (5 bytes) does not have its checksum"));
}

TEST_F(Verifying, RemovesARecordWithoutAFile) {
  data_.putItem(kThumbs, "a", "value");
  record("lost", 4);
  EXPECT_THAT(findings(), ElementsAre("record without file: 'lost' (4 bytes recorded)"));
  EXPECT_THAT(repairs(), ElementsAre("record without file: 'lost' (4 bytes recorded); record removed"));
  EXPECT_THAT(data_.rows(kThumbs), ElementsAre("a 5 0 -"));
  EXPECT_THAT(repairs(), IsEmpty());
}

TEST_F(Verifying, TakesADirectoryOrAReservedFileForNoValue) {
  record("folder", 4);
  fs::create_directories(data_.path(kThumbs + "/folder"));
  data_.putRecord(kThumbs, {"key", "manifest_v1.sqlite", 4, false, 1, 1, nullptr});
  EXPECT_THAT(findings(), UnorderedElementsAre("record without file: 'folder' (4 bytes recorded)",
                                               "record without file: 'key' (4 bytes recorded)"));
  repairs();
  EXPECT_THAT(repairs(), IsEmpty());
  EXPECT_TRUE(exists(kThumbs + "/folder"));
}

TEST_F(Verifying, GivesARecordTheSizeOfItsFile) {
  data_.putItem(kThumbs, "a", "value");
  data_.putFile(kThumbs + "/a", "longer value");
  EXPECT_THAT(findings(), ElementsAre("size differs: 'a' has 12 bytes, recorded are 5"));
  EXPECT_THAT(repairs(), ElementsAre("size differs: 'a' has 12 bytes, recorded are 5; size recorded"));
  EXPECT_THAT(data_.rows(kThumbs), ElementsAre("a 12 0 -"));
  EXPECT_EQ(contentOf(kThumbs + "/a"), "longer value");
  EXPECT_THAT(repairs(), IsEmpty());
}

TEST_F(Verifying, KeepsAnInlineValueWhoseSizeIsWrong) {
  data_.putInline(kInline, "a", "inline");
  data_.run(kInline, "UPDATE LarderManifest SET size = 2, extended_manifest = x'7b7d'");
  EXPECT_THAT(repairs(), ElementsAre("size differs: 'a' has 6 bytes, recorded are 2; size recorded"));
  EXPECT_THAT(data_.rows(kInline), ElementsAre("a 6 1 6"));
  EXPECT_THAT(repairs(), IsEmpty());
}

TEST_F(Verifying, RemovesARecordWhoseInlineValueHasGone) {
  data_.putInline(kInline, "gone", "inline");
  data_.putInline(kInline, "hollow", "inline");
  data_.run(kInline, "UPDATE LarderManifest SET inline_data = NULL WHERE key = 'gone'");
  data_.run(kInline, "UPDATE LarderManifest SET inline_data = x'' WHERE key = 'hollow'");
  EXPECT_THAT(repairs(), UnorderedElementsAre("inline value missing: 'gone' (6 bytes recorded); record removed",
                                              "inline value missing: 'hollow' (6 bytes recorded); record removed"));
  EXPECT_THAT(data_.rows(kInline), IsEmpty());
}

TEST_F(Verifying, SettlesInterruptedWritesWithAndWithoutAFile) {
  data_.putItem(kThumbs, "a", "value");
  data_.putFile(kThumbs + "/half", "ha");
  data_.killWhileWriting(kThumbs, "half");
  record("never", 0);
  EXPECT_THAT(repairs(), UnorderedElementsAre(
                             "interrupted write: 'half' has a file of 2 bytes, and a provisional record; size recorded",
                             "interrupted write: 'never' has a provisional record, and no file; record removed"));
  EXPECT_THAT(data_.rows(kThumbs), ElementsAre("a 5 0 -", "half 2 0 -"));
  EXPECT_THAT(repairs(), IsEmpty());
}

TEST_F(Verifying, MovesAFileWithoutARecordIntoTheQuarantine) {
  data_.putItem(kThumbs, "a", "value");
  data_.putFile(kThumbs + "/stray", "precious");
  data_.putFile(kThumbs + "/deep/er/stray", "deep");
  data_.putFile(kThumbs + "/manifest_v1.sqlite2", "a key like any other");
  EXPECT_THAT(
      repairs(),
      UnorderedElementsAre(
          "file without record: 'stray' (8 bytes); moved to " + kQuarantined + "/stray",
          "file without record: 'deep/er/stray' (4 bytes); moved to " + kQuarantined + "/deep/er/stray",
          "file without record: 'manifest_v1.sqlite2' (20 bytes); moved to " + kQuarantined + "/manifest_v1.sqlite2"));
  EXPECT_FALSE(exists(kThumbs + "/stray"));
  EXPECT_EQ(contentOf(kQuarantined + "/stray"), "precious");
  EXPECT_EQ(contentOf(kThumbs + "/a"), "value");
  EXPECT_THAT(repairs(), IsEmpty());
}

TEST_F(Verifying, ReplacesNothingInTheQuarantine) {
  data_.makeStore(kThumbs);
  for (const char* const value : {"first", "second", "third"}) {
    data_.putFile(kThumbs + "/stray", value);
    repairs();
  }
  EXPECT_EQ(contentOf(kQuarantined + "/stray"), "first");
  EXPECT_EQ(contentOf(kQuarantined + "/stray.1"), "second");
  EXPECT_EQ(contentOf(kQuarantined + "/stray.2"), "third");
}

TEST_F(Verifying, MovesALinkAndNotWhatItLeadsTo) {
  data_.makeStore(kThumbs);
  data_.putFile("elsewhere/file", "precious");
  fs::create_symlink(data_.path("elsewhere/file"), data_.path(kThumbs + "/link"));
  record("dangling", 3);
  fs::create_symlink("nowhere", data_.path(kThumbs + "/dangling"));
  EXPECT_EQ(repairs().size(), 3U);
  EXPECT_EQ(contentOf("elsewhere/file"), "precious");
  EXPECT_TRUE(exists(kQuarantined + "/link"));
  EXPECT_TRUE(exists(kQuarantined + "/dangling"));
  EXPECT_THAT(repairs(), IsEmpty());
}

TEST_F(Verifying, FindsValuesOfKeysWithSlashes) {
  data_.putItem(kThumbs, "sub/key", "value");
  data_.putRecord(kThumbs, {"./dotted", "./dotted", 1, false, 1, 1, nullptr});
  data_.putFile(kThumbs + "/dotted", "x");
  data_.putRecord(kThumbs, {"../outside", "../outside", 1, false, 1, 1, nullptr});
  data_.putFile(kManager + "/outside", "x");
  EXPECT_THAT(findings(), IsEmpty());
}

TEST_F(Verifying, AnInlineItemNeedsNoFileAndExplainsNone) {
  data_.putInline(kInline, "a", "inline");
  data_.putFile(kInline + "/a", "left by an earlier program");
  EXPECT_THAT(findings(), ElementsAre("file without record: 'a' (26 bytes)"));
}

TEST_F(Verifying, PutsADamagedManifestIntoTheQuarantineWithItsValues) {
  data_.putItem(kThumbs, "a", "value");
  data_.putFile(kThumbs + "/manifest_v1.sqlite", std::string(5000, 'x'));
  data_.putFile(kThumbs + "/manifest_v1.sqlite-wal", "log");
  data_.putFile(kThumbs + "/manifest_v1.sqlite-shm", "index");
  data_.putFile(kThumbs + "/_cellar_extended_attributes", "{}");
  const auto found = findings();
  EXPECT_THAT(found, ElementsAre("damaged manifest: SQLite Error #26: file is not a database"));
  EXPECT_THAT(repairs(), ElementsAre(testing::EndsWith("; moved to " + kQuarantined +
                                                       "/manifest_v1.sqlite, with 1 file of values")));
  EXPECT_EQ(contentOf(kQuarantined + "/a"), "value");
  EXPECT_EQ(contentOf(kQuarantined + "/manifest_v1.sqlite"), std::string(5000, 'x'));
  EXPECT_EQ(contentOf(kQuarantined + "/manifest_v1.sqlite-wal"), "log");
  EXPECT_EQ(contentOf(kQuarantined + "/manifest_v1.sqlite-shm"), "index");
  EXPECT_THAT(data_.directory().names("root/" + kThumbs), ElementsAre("_cellar_extended_attributes"));
  EXPECT_THAT(repairs(), IsEmpty());
}

TEST_F(Verifying, PutsAttributesThatAreNotJsonIntoTheQuarantine) {
  data_.putFile(kManager + "/web_v1/deep/_cellar_extended_attributes", "{\"size\":");
  data_.putFile(kManager + "/web_v1/_cellar_extended_attributes", "{\"size\":1}");
  EXPECT_THAT(repairs(), ElementsAre("damaged attributes: 'deep/_cellar_extended_attributes' is not JSON; moved to "
                                     "caches/_cellar_quarantine/_sessionlessStore/web_v1/deep/"
                                     "_cellar_extended_attributes"));
  EXPECT_THAT(repairs(), IsEmpty());
}

TEST_F(Verifying, OfAManagerOrStoreUsesTheQuarantineBesideTheManagers) {
  data_.makeStore(kThumbs);
  data_.putFile(kThumbs + "/stray", "x");
  EXPECT_THAT(repairs(kManager), ElementsAre("file without record: 'stray' (1 byte); moved to "
                                             "../_cellar_quarantine/_sessionlessStore/thumbs_v1/stray"));
  data_.putFile(kThumbs + "/another", "x");
  EXPECT_THAT(repairs(kThumbs), ElementsAre("file without record: 'another' (1 byte); moved to "
                                            "../../_cellar_quarantine/_sessionlessStore/thumbs_v1/another"));
  EXPECT_THAT(data_.directory().names("root/" + kQuarantined), ElementsAre("another", "stray"));
}

TEST_F(Verifying, HasRoomInTheQuarantineForEachFileOfTheLongestName) {
  const std::string longest(255, 'n');
  data_.makeStore(kThumbs);
  for (const std::string content : {"first", "second"}) {
    data_.putFile(kThumbs + "/" + longest, content);
    EXPECT_THAT(repairs(), ElementsAre(testing::Not(testing::HasSubstr("NOT REPAIRED"))));
  }
  EXPECT_EQ(contentOf(kQuarantined + "/" + longest), "first");
  EXPECT_EQ(contentOf(kQuarantined + "/" + longest.substr(2) + ".1"), "second");
}

TEST_F(Verifying, OfAStoreThatStandsByItselfUsesAQuarantineBesideIt) {
  data_.makeStore("pulled/thumbs_v1");
  data_.putFile("pulled/thumbs_v1/stray", "x");
  EXPECT_THAT(repairs("pulled/thumbs_v1"),
              ElementsAre("file without record: 'stray' (1 byte); moved to ../_cellar_quarantine/thumbs_v1/stray"));
}

TEST_F(Verifying, SaysWhatCouldNotBeRepairedAndCountsItAsRemaining) {
  data_.makeStore(kThumbs);
  data_.putFile(kThumbs + "/stray", "x");
  data_.putFile("caches/_cellar_quarantine", "a file in the way");
  EXPECT_THAT(repairs(), ElementsAre(testing::HasSubstr("; NOT REPAIRED: ")));
  EXPECT_EQ(result_.repaired, 0U);
  EXPECT_EQ(contentOf(kThumbs + "/stray"), "x");
}

TEST_F(Verifying, FindsTriggersAndViewsThatSomebodyElseHasMade) {
  data_.putItem(kThumbs, "a", "value");
  data_.run(kThumbs,
            "CREATE TRIGGER spy AFTER UPDATE ON LarderManifest BEGIN DELETE FROM LarderManifest; END;"
            "CREATE VIEW look AS SELECT key FROM LarderManifest");
  EXPECT_THAT(findings(), ElementsAre("foreign part: the manifest has the trigger 'spy', which no store uses",
                                      "foreign part: the manifest has the view 'look', which no store uses"));
  EXPECT_THAT(repairs(), testing::Each(testing::HasSubstr("; NOT REPAIRED: ")));
  EXPECT_THAT(data_.rows(kThumbs), ElementsAre("a 5 0 -"));
}

TEST_F(Verifying, DoesNotCheckATableThatSomebodyElseHasMade) {
  data_.putItem(kThumbs, "a", "value");
  data_.run(
      kThumbs,
      "CREATE TABLE other (x, y AS (length(hex(zeroblob(x)))), CHECK (x > 0)); PRAGMA ignore_check_constraints = 1;"
      "INSERT INTO other VALUES (-1); INSERT INTO other VALUES (490000000)");
  EXPECT_THAT(findings(), ElementsAre("foreign part: the manifest has the table 'other', which no store uses"));
}

TEST_F(Verifying, LeavesNoCopyOfAManifestWhenItIsInterrupted) {
  data_.putFile(kThumbs + "/stray", "x");
  data_.makeStore(kThumbs);
  const std::string temporary = data_.directory().file("temporary");
  fs::create_directory(temporary);
  ASSERT_EQ(::setenv("TMPDIR", temporary.c_str(), 1), 0);
  bool hadCopy = false;
  const auto interrupt = [&](std::uint64_t) {
    hadCopy = !fs::is_empty(temporary);
    throw Interrupted{SIGINT};
  };
  EXPECT_THROW(verify(findLayout(data_.root()), false, interrupt, [](const std::string&) {}), Interrupted);
  EXPECT_EQ(::unsetenv("TMPDIR"), 0);
  EXPECT_TRUE(hadCopy);
  EXPECT_TRUE(fs::is_empty(temporary));
}

TEST_F(Verifying, FindsAManifestThatIsMissingOrNoFile) {
  data_.putItem(kThumbs, "a", "value");
  const std::string manifest = kThumbs + "/manifest_v1.sqlite";
  fs::remove(data_.path(manifest));
  fs::remove(data_.path(manifest + "-shm"));
  data_.putFile(manifest + "-wal", "log");
  const std::string finding =
      "missing manifest: there is no 'manifest_v1.sqlite', but 'manifest_v1.sqlite-wal' is there";
  EXPECT_THAT(findings(), ElementsAre(finding));
  EXPECT_THAT(repairs(), ElementsAre(testing::StartsWith(finding + "; NOT REPAIRED: ")));
  EXPECT_EQ(contentOf(kThumbs + "/a"), "value");
  fs::create_directory(data_.path(manifest));
  EXPECT_THAT(findings(), ElementsAre("cannot be read: not a regular file"));
}

TEST_F(Verifying, LeavesADamagedManifestToAStoreThatTheConfigurationCallsSafe) {
  const ConfiguredStores configured(data_.directory().write("configuration.json", R"({"m": {"session_scoped": false,
    "stores": { "thumbs": { "type": "disk_cache", "has_version": true, "durability": "safe", "inline_data": true } } } })"));
  const std::string manifest = kThumbs + "/manifest_v1.sqlite";
  data_.putFile(manifest, std::string(8192, 'x'));
  const auto result = verify(
      findLayout(data_.root()), configured, true, [](std::uint64_t) {}, [](const std::string&) {});
  ASSERT_EQ(result.all.size(), 1U);
  EXPECT_EQ(result.all.front().outcome,
            "NOT REPAIRED: the store salvages it at its next start, if it is safe or synced");
  EXPECT_TRUE(fs::exists(data_.path(manifest)));
}

TEST_F(Verifying, KnowsFromTheConfigurationWhichStoresHaveAManifest) {
  const ConfiguredStores configured(data_.directory().write("configuration.json", R"({"m": {"session_scoped": false,
    "stores": { "thumbs": { "type": "pkvs", "has_version": true }, "web": { "type": "unmanaged", "has_version": true },
                "new": { "type": "pkvs", "has_version": true } } } })"));
  data_.putFile(kThumbs + "/a", "value");
  data_.putFile(kManager + "/web_v1/page", "page");
  data_.putFile(kManager + "/new_v1/_cellar_extended_attributes", "{}");
  EXPECT_THAT(findings(), IsEmpty());
  const Layout layout = findLayout(data_.root());
  const auto result = verify(
      layout, configured, false, [](std::uint64_t) {}, [](const std::string&) {});
  ASSERT_EQ(result.all.size(), 1U);
  EXPECT_EQ(describe(result.all.front().finding),
            "missing manifest: there is no 'manifest_v1.sqlite', but 'a' is there");
  const auto json = verificationAsJson(layout, result);
  EXPECT_EQ(json["stores"], 3);
  EXPECT_EQ(json["findings"][0]["kind"], "missing_manifest");
  EXPECT_EQ(json["findings"][0]["path"], kThumbs);
  EXPECT_EQ(json["findings"][0]["repaired"], false);
}

TEST_F(Verifying, EverythingAtOnceIsSoundAfterOneRepair) {
  data_.putItem(kThumbs, "a", "value");
  data_.putFile(kThumbs + "/stray", "x");
  record("lost", 4);
  record("never", 0);
  data_.putFile(kThumbs + "/_cellar_extended_attributes", "no");
  data_.putInline(kInline, "b", "inline");
  data_.putFile(kInline + "/manifest_v1.sqlite", "too short");
  EXPECT_EQ(repairs().size(), 5U);
  EXPECT_EQ(result_.repaired, 5U);
  EXPECT_THAT(repairs(), IsEmpty());
  EXPECT_EQ(result_.stores, 2U);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
