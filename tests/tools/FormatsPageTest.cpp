// docs/formats.md says what the library writes.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sqlite3.h>

#include <fstream>
#include <iterator>
#include <memory>
#include <string>
#include <vector>

#include <cellar/AttributeStore.h>
#include <cellar/Configuration.h>
#include <cellar/DiskSizeCalculator.h>
#include <cellar/Durability.h>
#include <cellar/ExtendedMetadata.h>
#include <cellar/FileUtils.h>
#include <cellar/ManifestSnapshot.h>
#include <cellar/SQLiteManifestPersistence.h>
#include <cellar/StoreDirectoryNameBuilder.h>
#include <cellar/StoreManagerImplCommon.h>
#include <cellar/TrashCollector.h>

#include "host/testing/ManualQueue.h"
#include "storage/Layout.h"
#include "storage/StoreFiles.h"
#include "support/KeyValueStoreFixture.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using testing::HasSubstr;
using testing::MatchesRegex;

std::string page() {
  std::ifstream file(CELLAR_DOCS "/formats.md", std::ios::binary);
  return {std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>()};
}

// The first two cells of each row of a table, as the page has them: "| `key` | TEXT |".
std::string rowOf(const std::string& name, const std::string& type) { return "| `" + name + "` | " + type + " |"; }

std::string storeName(bool localeSensitive, bool hasVersion, const std::string& name, unsigned int version) {
  const UnmanagedStoreDefinition store(name, "manager", localeSensitive, hasVersion, version, 0, true);
  return StoreDirectoryNameBuilder("250", "US", "en").buildStoreName(store);
}

// The columns of the manifest that a store of this durability makes, as the page has them.
std::vector<std::string> columnsOf(Durability durability) {
  const test::TemporaryDirectory directory;
  const std::string path = directory.file(ManifestSnapshot::manifestName);
  { const SQLiteManifestPersistence manifest(path, nullptr, nullptr, durability); }
  sqlite3* database = nullptr;
  EXPECT_EQ(sqlite3_open(path.c_str(), &database), SQLITE_OK);
  std::vector<std::string> rows;
  const auto collect = [](void* target, int, char** values, char**) {
    static_cast<std::vector<std::string>*>(target)->push_back(rowOf(values[1], values[2]));
    return 0;
  };
  EXPECT_EQ(sqlite3_exec(database, "PRAGMA table_info(LarderManifest)", collect, &rows, nullptr), SQLITE_OK);
  sqlite3_close(database);
  return rows;
}

TEST(FormatsPage, NamesTheColumnsOfTheManifestInTheirOrder) {
  const auto rows = columnsOf(Durability::Safe);
  ASSERT_EQ(rows.size(), 9U);
  EXPECT_EQ(columnsOf(Durability::Relaxed), std::vector<std::string>(rows.begin(), rows.end() - 1));
  const std::string text = page();
  std::size_t place = 0;
  for (const std::string& row : rows) {
    const auto found = text.find(row, place);
    ASSERT_NE(found, std::string::npos) << row;
    place = found;
  }
}

class FormatsPageOfASafeStore : public test::KeyValueStoreFixture {
 protected:
  FormatsPageOfASafeStore() {
    options.durability = Durability::Safe;
    open();
  }

  // The only file after a value was written.
  std::string fileOf(const std::string& key, const std::string& value) {
    put(key, value);
    return valueFiles().size() == 1 ? valueFiles().front() : "there are " + std::to_string(valueFiles().size());
  }
};

TEST_F(FormatsPageOfASafeStore, NamesItsFiles) {
  const std::string text = page();
  for (int i = 1; i < 17; ++i) put("letter one", "a draft");
  const std::string name = fileOf("letter one", "Dear Ada");
  EXPECT_THAT(text, HasSubstr("── " + name + " "));
  EXPECT_THAT(text, HasSubstr("| `" + name + "` |"));
  drop("letter one");
  const std::string cut = fileOf(std::string(201, 'x'), "Dear Ada");
  EXPECT_EQ(cut.rfind(std::string(60, 'x') + "~", 0), 0U) << cut;
  EXPECT_THAT(text, HasSubstr("| `xxxxxxxx" + cut.substr(60) + "` |"));
  drop(std::string(201, 'x'));
  EXPECT_EQ(fileOf(std::string(200, 'x'), "Dear Ada").rfind(std::string(200, 'x') + ".19.", 0), 0U);
}

TEST_F(FormatsPageOfASafeStore, NamesTheFileOfAWriterThatHasNotFinished) {
  for (int i = 1; i < 19; ++i) put("letter one", "a draft");
  std::string seen;
  const PersistentKeyValueStore::Writer writer = [&](const std::string& path) {
    seen = path.substr(path.rfind('/') + 1);
    return writing("", 0)(path);
  };
  test::watch(store->store("letter one", nullptr, writer));
  settle();
  EXPECT_THAT(page(), HasSubstr("| `" + seen + "` |"));
}

TEST(FormatsPage, NamesWhatASafeStoreHasBeside) {
  EXPECT_THAT(page(), HasSubstr("| `" + newManifestName() + "` |"));
  EXPECT_THAT(page(), HasSubstr("| `" + salvagedManifestName() + "` |"));
  EXPECT_THAT(page(), HasSubstr(std::string("── ") + kStoreQuarantine + "/"));
}

TEST(FormatsPage, NamesDirectoriesAsTheyAreBuilt) {
  const std::string text = page();
  EXPECT_THAT(text,
              HasSubstr("| no | no | name, version tag, version | `" + storeName(false, false, "thumbs", 1) + "` |"));
  EXPECT_THAT(text, HasSubstr("| no | yes | name, version | `" + storeName(false, true, "fonts", 2) + "` |"));
  EXPECT_THAT(text, HasSubstr("| yes | no | name, locale, version tag, version | `" +
                              storeName(true, false, "letters", 1) + "` |"));
  EXPECT_THAT(text, HasSubstr("| yes | yes | name, locale, version | `" + storeName(true, true, "letters", 3) + "` |"));
  EXPECT_THAT(text, HasSubstr("── " + StoreDirectoryNameBuilder("", "", "").buildStoreManagerName() + "/"));
  EXPECT_THAT(text, HasSubstr("── " + StoreDirectoryNameBuilder("", "", "", "alice").buildStoreManagerName() + "/"));
  EXPECT_THAT(text, HasSubstr("── " + StoreManagerImplCommon::TemporaryDirectoryName + "/"));
  EXPECT_THAT(text, HasSubstr(std::string("── ") + kQuarantineName + "/"));
}

TEST(FormatsPage, NamesTheFilesThatAreNoValues) {
  const std::string text = page();
  const std::string& manifest = ManifestSnapshot::manifestName;
  EXPECT_THAT(text, HasSubstr("Not values, whatever the records say: `" + manifest +
                              "` and its `-wal`, `-shm` and `-journal`, and `" + AttributeStore::fileName + "`."));
  for (const char* const suffix : {"", "-wal", "-shm", "-journal"}) EXPECT_TRUE(isManifestFile(manifest + suffix));
  EXPECT_FALSE(isManifestFile(manifest + "2"));
}

TEST(FormatsPage, ShowsMetadataAsItIsWritten) {
  const VideoDownloadExtendedMetadata chunk(12, VideoDownloadExtendedMetadata::ItemType::VideoChunk);
  const auto bytes = chunk.serialize();
  EXPECT_THAT(page(), HasSubstr("```\n" + std::string(bytes.begin(), bytes.end()) + "\n```"));
  EXPECT_THAT(page(),
              HasSubstr("of second " + std::to_string(VideoDownloadExtendedMetadata::DefaultChunkSecond) + "."));
}

TEST(FormatsPage, NamesTheMembersOfAttributes) {
  for (const std::string& member :
       {DiskSizeCalculator::ATTR_SIZE, DiskSizeCalculator::ATTR_FILE_COUNT, DiskSizeCalculator::ATTR_TIME_SPENT,
        DiskSizeCalculator::ATTR_TIME_STAMP, StoreManagerImplCommon::TrashOnStartupKey}) {
    EXPECT_THAT(page(), HasSubstr("| `" + member + "` |"));
  }
}

TEST(FormatsPage, DescribesTheNamesInTheTrash) {
  const test::TemporaryDirectory directory;
  directory.makeDirectory("old");
  const auto queues = std::make_shared<test::ManualQueueFactory>();
  TrashCollector trash(directory.file("trash"), std::make_shared<FileUtils>(), nullptr, queues);
  ASSERT_TRUE(trash.collectPath(directory.file("old")));
  const auto names = directory.names("trash");
  ASSERT_EQ(names.size(), 1U);
  EXPECT_THAT(names.front(), MatchesRegex("[0-9a-f]{16}"));
  EXPECT_THAT(page(), HasSubstr("under a name of 16 hexadecimal digits"));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
