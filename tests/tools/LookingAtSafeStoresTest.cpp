// The commands on what a safe store leaves, which is written here by the store itself.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>
#include <unistd.h>

#include <array>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>
#include <vector>

#include "Console.h"
#include "EncodedFileName.h"
#include "inspect/Survey.h"
#include "inspect/SurveyJson.h"
#include "inspect/SurveyText.h"
#include "storage/ConfiguredStores.h"
#include "storage/Layout.h"
#include "storage/SafeFiles.h"
#include "support/KeyValueStoreFixture.h"
#include "verify/Verification.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using test::bytesOf;
using test::KeyValueStoreFixture;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using testing::SizeIs;
using testing::UnorderedElementsAre;

namespace fs = std::filesystem;

const std::string kQuarantined = "../_cellar_quarantine/store/";

// The name of a file with a value, number and checksum.
std::string nameOf(const std::string& key, std::uint64_t number, std::uint32_t checksum) {
  std::array<char, 9> digits{};
  (void)std::snprintf(digits.data(), digits.size(), "%08x", checksum);
  const std::string name = key.size() > 200 ? encodeFileName(key.substr(0, 60)) + "~" : encodeFileName(key);
  return name + "." + std::to_string(number) + "." + digits.data();
}

// --- verify ---

class LookingAtASafeStore : public KeyValueStoreFixture {
 protected:
  LookingAtASafeStore() { options.durability = Durability::Safe; }

  std::vector<std::string> findings(bool repair = false) { return findings(repair, storePath()); }

  std::vector<std::string> findings(bool repair, const std::string& path) {
    std::vector<std::string> lines;
    result_ = verify(
        findLayout(path), repair, [](std::uint64_t) {},
        [&](const std::string& line) { lines.push_back(line.substr(line.find(": ") + 2)); });
    EXPECT_EQ(result_.findings, lines.size());
    return lines;
  }

  std::vector<std::string> repairs() { return findings(true); }

  void overwrite(const std::string& name, const std::string& text) const {
    std::ofstream(pathOf(name), std::ios::binary) << text;
  }

  std::string manifestPath() const { return pathOf("manifest_v1.sqlite"); }

  void damageManifest() const {
    for (const char* const suffix : {"-wal", "-shm"}) fs::remove(manifestPath() + suffix);
    overwrite("manifest_v1.sqlite", "This is not a database, and it is long enough to be read.");
  }

  void execute(const std::string& statement) const {
    sqlite3* database = nullptr;
    ASSERT_EQ(sqlite3_open(manifestPath().c_str(), &database), SQLITE_OK);
    EXPECT_EQ(sqlite3_exec(database, statement.c_str(), nullptr, nullptr, nullptr), SQLITE_OK) << statement;
    sqlite3_close(database);
  }

  std::string onlyFile() const {
    const auto names = valueFiles();
    return names.size() == 1 ? names.front() : "there are " + std::to_string(names.size());
  }

  // The file that a killed process leaves of a value.
  std::string leave(const std::string& key, const std::string& value, std::uint64_t number) const {
    std::string name = nameOf(key, number, checksumOf(key, bytesOf(value)));
    overwrite(name, value);
    return name;
  }

  std::string contentOf(const std::string& quarantined) const {
    return directory.read("_cellar_quarantine/store/" + quarantined);
  }

  VerificationResult result_;
};

TEST_F(LookingAtASafeStore, UnderstandsTheNamesAndChecksumsThatItGives) {
  std::uint64_t number = 0;
  open();
  for (const std::string& key : {std::string("a"), std::string(), std::string("A/b\0c", 5), std::string("a.1.00000000"),
                                 std::string(150, '/'), std::string(1000, 'x')}) {
    for (const std::string& value : {std::string(), std::string("value"), std::string(200'000, 'x')}) {
      put(key, value);
      const std::string name = onlyFile();
      const auto parsed = parseSafeFileName(name);
      ASSERT_TRUE(parsed) << name;
      EXPECT_EQ(parsed->key.value_or(key), key);
      EXPECT_EQ(parsed->key.has_value(), key.size() < 50) << name;
      EXPECT_EQ(parsed->number, ++number);
      EXPECT_EQ(parsed->checksum, checksumOf(key, bytesOf(value)));
      EXPECT_EQ(parsed->checksum, checksumOfFile(key, pathOf(name)));
      EXPECT_FALSE(parsed->isUnfinished);
      EXPECT_TRUE(parseSafeFileName(name + ".part")->isUnfinished);
    }
    drop(key);
  }
}

TEST_F(LookingAtASafeStore, TakesNoOtherNameForOneThatItGives) {
  for (const char* const name : {"", "a", "a.1", "a.1.0000000", "a.1.0000000G", "a..00000000", ".1.00000000",
                                 "A.1.00000000", "a.12345678901234567890.00000000", "manifest_v1.sqlite", "~"}) {
    EXPECT_FALSE(parseSafeFileName(name)) << name;
  }
}

TEST_F(LookingAtASafeStore, FindsNothingInASoundOne) {
  for (const bool isInline : {false, true}) {
    options.inlineData = isInline;
    open();
    for (const std::string& key : {std::string(), std::string("a/../b"), std::string(1000, 'x')}) put(key, "value");
    put("empty", "");
    put("replaced", "old");
    put("replaced", "new");
    EXPECT_THAT(findings(), IsEmpty());
    close();
    EXPECT_THAT(repairs(), IsEmpty());
  }
  options.durability = Durability::Relaxed;
  open();
  put("relaxed", "value");
  close();
  EXPECT_THAT(repairs(), IsEmpty());
}

TEST_F(LookingAtASafeStore, MovesADamagedFileToTheQuarantineWithItsRecord) {
  open();
  put("a", "right");
  close();
  const std::string name = onlyFile();
  overwrite(name, "wrong");
  EXPECT_THAT(findings(), ElementsAre("damaged value: 'a' (5 bytes) does not have its checksum"));
  EXPECT_THAT(repairs(), ElementsAre("damaged value: 'a' (5 bytes) does not have its checksum; moved to " +
                                     kQuarantined + name + ", record removed"));
  EXPECT_EQ(contentOf(name), "wrong");
  EXPECT_THAT(repairs(), IsEmpty());
  open();
  EXPECT_EQ(get("a"), "<miss>");
}

TEST_F(LookingAtASafeStore, GivesADamagedFileNoSize) {
  open();
  put("a", "right");
  close();
  overwrite(onlyFile(), "right and more");
  EXPECT_THAT(findings(), ElementsAre("damaged value: 'a' (14 bytes) does not have its checksum"));
}

TEST_F(LookingAtASafeStore, CorrectsTheSizeOfAValueThatHasItsChecksum) {
  open();
  put("a", "right");
  close();
  execute("UPDATE LarderManifest SET size = 7");
  EXPECT_THAT(repairs(), ElementsAre("size differs: 'a' has 5 bytes, recorded are 7; size recorded"));
  EXPECT_THAT(repairs(), IsEmpty());
  open();
  EXPECT_EQ(get("a"), "right");
}

TEST_F(LookingAtASafeStore, MovesADamagedInlineValueToTheQuarantineWithItsRecord) {
  options.inlineData = true;
  open();
  put("A/b", "right");
  put("b", "right");
  close();
  execute("UPDATE LarderManifest SET inline_data = X'78' WHERE key = 'A/b'");
  EXPECT_THAT(repairs(), ElementsAre("damaged value: 'A/b' (1 byte) does not have its checksum; moved to " +
                                     kQuarantined + "%41%2fb, record removed"));
  EXPECT_EQ(contentOf("%41%2fb"), "x");
  EXPECT_THAT(repairs(), IsEmpty());
  open();
  EXPECT_THAT(store->getAllKeys(), ElementsAre("b"));
  EXPECT_EQ(get("b"), "right");
}

TEST_F(LookingAtASafeStore, SaysThatAValueCannotBeReadAndLeavesIt) {
  if (geteuid() == 0) GTEST_SKIP() << "root reads everything";
  open();
  put("a", "1");
  close();
  fs::permissions(pathOf(onlyFile()), fs::perms(0));
  EXPECT_THAT(repairs(), ElementsAre(HasSubstr("unreadable value: 'a': ")));
  EXPECT_EQ(result_.repaired, 0U);
}

TEST_F(LookingAtASafeStore, RemovesWhatAKillHasLeftBesideASoundValue) {
  open();
  put("a", "2");
  close();
  const std::string earlier = leave("a", "1", 90);
  const std::string later = leave("a", "3", 91);
  const std::string unfinished = nameOf("b", 92, 0) + ".part";
  overwrite(unfinished, "12");
  overwrite("manifest_v1.sqlite-new", "rows");
  EXPECT_THAT(findings(), UnorderedElementsAre("superseded file: '" + earlier + "' (1 byte)",
                                               "superseded file: '" + later + "' (1 byte)",
                                               "unfinished file: '" + unfinished + "' (2 bytes)",
                                               "unfinished manifest: 'manifest_v1.sqlite-new' (4 bytes)"));
  EXPECT_THAT(repairs(), testing::Each(testing::EndsWith("; file removed")));
  EXPECT_THAT(repairs(), IsEmpty());
  open();
  EXPECT_EQ(get("a"), "2");
}

TEST_F(LookingAtASafeStore, KeepsAFileThatItsRecordNamesInAnotherWay) {
  open();
  put("a", "1");
  close();
  const std::string file = onlyFile();
  const std::string link = nameOf("a", 92, parseSafeFileName(file)->checksum);
  fs::create_symlink(file, pathOf(link));
  fs::create_directory_symlink(".", pathOf("sub"));
  for (const std::string& name : {"'" + link + "'", "'sub/" + file + "'", "'" + file + "' || char(0) || 'x'"}) {
    execute("UPDATE LarderManifest SET filename = " + name);
    repairs();
    EXPECT_TRUE(fs::is_regular_file(pathOf(file))) << name;
  }
}

TEST_F(LookingAtASafeStore, FindsALinkToAValueThatNoRecordNames) {
  open();
  put("a", "1");
  close();
  fs::create_symlink(onlyFile(), pathOf("link"));
  EXPECT_THAT(findings(), ElementsAre("file without record: 'link' (0 bytes)"));
}

TEST_F(LookingAtASafeStore, KeepsFilesWhoseKeyHasNoOtherValue) {
  open();
  put("a", "1");
  close();
  const std::string damaged = onlyFile();
  overwrite(damaged, "?");
  const std::string ofDamaged = leave("a", "0", 90);
  const std::string ofNobody = leave("b", "1", 91);
  const std::string ofLongKey = leave(std::string(300, 'x'), "1", 92);
  repairs();
  EXPECT_EQ(result_.repaired, 4U);
  for (const std::string& name : {damaged, ofDamaged, ofNobody, ofLongKey}) EXPECT_THAT(contentOf(name), SizeIs(1));
  EXPECT_THAT(valueFiles(), IsEmpty());
}

TEST_F(LookingAtASafeStore, RecordsTheLatestOtherValueOfAKeyWhoseFileIsMissing) {
  open();
  put("a", "gone");
  close();
  fs::remove(pathOf(onlyFile()));
  const std::string earlier = leave("a", "1", 90);
  const std::string latest = leave("a", "second", 91);
  const std::string damaged = leave("a", "3", 92);
  overwrite(damaged, "?");
  EXPECT_THAT(repairs(), UnorderedElementsAre(
                             "record without file: 'a' (4 bytes recorded), but '" + latest +
                                 "' has a value of the key; file recorded",
                             "file without record: '" + earlier + "' (1 byte); moved to " + kQuarantined + earlier,
                             "file without record: '" + damaged + "' (1 byte); moved to " + kQuarantined + damaged));
  EXPECT_THAT(repairs(), IsEmpty());
  open();
  EXPECT_EQ(get("a"), "second");
}

TEST_F(LookingAtASafeStore, RemovesARecordWhoseFileIsMissing) {
  open();
  put("a", "gone");
  put("empty", "");
  close();
  for (const std::string& name : valueFiles()) fs::remove(pathOf(name));
  EXPECT_THAT(repairs(), UnorderedElementsAre("record without file: 'a' (4 bytes recorded); record removed",
                                              "record without file: 'empty' (0 bytes recorded); record removed"));
  EXPECT_THAT(repairs(), IsEmpty());
}

TEST_F(LookingAtASafeStore, LeavesADamagedManifestToTheStore) {
  open();
  put("a", "1");
  close();
  damageManifest();
  EXPECT_THAT(repairs(), ElementsAre(testing::EndsWith(
                             "; NOT REPAIRED: the store salvages it at its next start, if it is safe or synced")));
  open();
  EXPECT_EQ(get("a"), "1");
}

TEST_F(LookingAtASafeStore, LeavesASalvageThatWasInterruptedToTheStore) {
  open();
  put("a", "1");
  close();
  fs::rename(manifestPath(), manifestPath() + "-salvaged");
  const std::string finding =
      "interrupted salvage: 'manifest_v1.sqlite-salvaged' is not in its place yet; NOT REPAIRED: the store puts it in "
      "its place at its next start";
  overwrite("manifest_v1.sqlite", "damaged");
  EXPECT_THAT(repairs(), ElementsAre(finding));
  fs::remove(manifestPath());
  const std::string manager = directory.makeDirectory("_sessionlessStore");
  fs::rename(storePath(), manager + "/store");
  EXPECT_THAT(findings(true, manager), ElementsAre(finding));
  fs::rename(manager + "/store", storePath());
  open();
  EXPECT_EQ(get("a"), "1");
}

TEST_F(LookingAtASafeStore, ReportsItsQuarantineAndLeavesItAlone) {
  open();
  put("a", "1");
  put("b", "2");
  close();
  damageManifest();
  overwrite(valueFiles().back(), "?");
  open();
  close();
  const auto before = directory.names("store/quarantine");
  const auto lines = repairs();
  ASSERT_THAT(lines, SizeIs(1));
  EXPECT_THAT(lines.front(),
              testing::StartsWith("quarantine: 'quarantine' has " + std::to_string(before.size()) + " files ("));
  EXPECT_THAT(lines.front(), HasSubstr("; NOT REPAIRED: look at what is in it, and remove it yourself"));
  EXPECT_EQ(result_.repaired, 0U);
  EXPECT_EQ(directory.names("store/quarantine"), before);
  open();
  EXPECT_EQ(get("a"), "1");
}

// --- inspect ---

class InspectingASafeStore : public LookingAtASafeStore {
 protected:
  Survey look() const {
    return makeSurvey(findLayout(storePath()), configured_, 5, kStart, [](std::uint64_t) {});
  }

  StoreSurvey figures() const { return look().managers.at(0).stores.at(0); }

  std::string text() const {
    std::ostringstream out;
    Console console(out, false, false);
    printSurvey(look(), console);
    return out.str();
  }

  ConfiguredStores configured_;
};

TEST_F(InspectingASafeStore, ShowsItsDurabilityByTheManifestOrByTheConfiguration) {
  open();
  put("a", "1");
  EXPECT_EQ(figures().durability, "checksums");
  EXPECT_EQ(figures().items, 1U);
  EXPECT_THAT(text(), HasSubstr(" checksums\n"));
  close();
  const std::string path = directory.file("caches/_sessionlessStore/drafts_v1");
  fs::create_directories(fs::path(path).parent_path());
  fs::rename(storePath(), path);
  options.directory = path;
  configured_ = ConfiguredStores(directory.write("configuration.json", R"({"m": {"session_scoped": false, "stores": {
      "drafts": {"type": "pkvs", "has_version": true, "durability": "synced"}}}})"));
  const Survey survey = makeSurvey(findLayout(path), configured_, 5, kStart, [](std::uint64_t) {});
  EXPECT_EQ(survey.managers.at(0).stores.at(0).durability, "synced");
  EXPECT_EQ(surveyAsJson(survey)["managers"][0]["stores"][0]["durability"], "synced");
}

TEST_F(InspectingASafeStore, KnowsNoDurabilityOfARelaxedOne) {
  options.durability = Durability::Relaxed;
  open();
  put("a", "1");
  EXPECT_EQ(figures().durability, "");
  EXPECT_TRUE(surveyAsJson(look())["managers"][0]["stores"][0]["durability"].is_null());
}

TEST_F(InspectingASafeStore, CountsItsQuarantineApartFromItsValues) {
  open();
  put("a", "123");
  directory.write("store/quarantine/b.1.00000000", "12");
  directory.write("store/quarantine/manifest_v1.sqlite", "12345");
  overwrite("manifest_v1.sqlite-new", "rows");
  const StoreSurvey survey = figures();
  EXPECT_EQ(survey.files, 1U);
  EXPECT_EQ(survey.fileBytes, 3U);
  EXPECT_EQ(survey.quarantinedFiles, 2U);
  EXPECT_EQ(survey.quarantinedBytes, 7U);
  EXPECT_THAT(text(), HasSubstr("store: 2 files (7 B) in quarantine, which the store could not use\n"));
  EXPECT_EQ(surveyAsJson(look())["managers"][0]["stores"][0]["quarantined_bytes"], 7);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
