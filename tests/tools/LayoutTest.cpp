#include "storage/Layout.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "InputError.h"
#include "storage/ConfiguredStores.h"
#include "tools/StoredData.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using test::StoredData;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;

class LayoutTest : public testing::Test {
 protected:
  // "manager: store store+", a "+" for a manifest; and what belongs to no store.
  std::vector<std::string> found(const std::string& below = "") {
    layout_ = findLayout(data_.path(below));
    std::vector<std::string> lines;
    for (const ManagerPlace& manager : layout_.managers) {
      std::string line = relativeTo(layout_.root, manager.path) + ":";
      for (const StorePlace& store : manager.stores) line += " " + store.name + (store.hasManifest ? "+" : "");
      lines.push_back(line);
    }
    for (const OtherPlace& other : layout_.others) lines.push_back(relativeTo(layout_.root, other.path));
    return lines;
  }

  std::string complaint(const std::string& path) {
    try {
      findLayout(path);
    } catch (const InputError& error) {
      return error.what();
    }
    return "";
  }

  void makeRoot() {
    data_.makeStore("caches/_sessionlessStore/thumbs_v1");
    data_.putFile("caches/_sessionlessStore/web_v1/page", "x");
    data_.putFile("caches/_sessionlessStore/tmp/half", "x");
    data_.makeStore("documents/_store_alice/drafts_v1");
    data_.putFile("trash/0123/file", "x");
    data_.putFile("_cellar_quarantine/caches/_sessionlessStore/thumbs_v1/stray", "x");
    data_.putFile("log.txt", "x");
  }

  StoredData data_;
  Layout layout_;
};

TEST_F(LayoutTest, OfARootHasItsAreasManagersAndStores) {
  makeRoot();
  EXPECT_THAT(found(), ElementsAre("caches/_sessionlessStore: thumbs_v1+ web_v1", "documents/_store_alice: drafts_v1+",
                                   "_cellar_quarantine", "caches/_sessionlessStore/tmp", "trash"));
  EXPECT_EQ(layout_.kind, Layout::Kind::Root);
  EXPECT_EQ(layout_.managers.at(0).area, "caches");
  EXPECT_TRUE(layout_.managers.at(0).isSessionless());
  EXPECT_EQ(layout_.managers.at(1).sessionTag(), "alice");
}

TEST_F(LayoutTest, OfSeveralAccountsHasTheAreasOfEach) {
  data_.makeStore("caches/_sessionlessStore/thumbs_v1");
  data_.makeStore("_cellar_accounts/of_alice/documents/_store_alice/drafts_v1");
  data_.makeStore("_cellar_accounts/of_/caches/_store_/thumbs_v1");
  EXPECT_THAT(found(), ElementsAre("_cellar_accounts/of_/caches/_store_: thumbs_v1+",
                                   "_cellar_accounts/of_alice/documents/_store_alice: drafts_v1+",
                                   "caches/_sessionlessStore: thumbs_v1+"));
  EXPECT_EQ(layout_.managers.at(1).area, "documents");
  EXPECT_EQ(layout_.managers.at(1).sessionTag(), "alice");
  EXPECT_THAT(found("_cellar_accounts/of_alice"), ElementsAre("documents/_store_alice: drafts_v1+"));
}

TEST_F(LayoutTest, OfAnyDepthIsRecognised) {
  makeRoot();
  EXPECT_THAT(found("documents"), ElementsAre("_store_alice: drafts_v1+"));
  EXPECT_EQ(layout_.kind, Layout::Kind::Area);
  EXPECT_THAT(found("documents/_store_alice"), ElementsAre(".: drafts_v1+"));
  EXPECT_EQ(layout_.kind, Layout::Kind::Manager);
  EXPECT_THAT(found("documents/_store_alice/drafts_v1"), ElementsAre("..: drafts_v1+"));
  EXPECT_EQ(layout_.kind, Layout::Kind::Store);
  EXPECT_EQ(layout_.managers.at(0).area, "documents");
  EXPECT_THAT(found("caches/_sessionlessStore/web_v1"), ElementsAre("..: web_v1"));
  EXPECT_EQ(layout_.kind, Layout::Kind::Store);
}

TEST_F(LayoutTest, OfAStoreOrManagerUnderAnotherNameIsRecognisedByItsManifest) {
  data_.makeStore("copied/thumbs_v1");
  EXPECT_THAT(found("copied"), ElementsAre(".: thumbs_v1+"));
  EXPECT_EQ(layout_.managers.at(0).name, "");
  EXPECT_THAT(found("copied/thumbs_v1"), ElementsAre("..: thumbs_v1+"));
}

TEST_F(LayoutTest, OfAnEmptyDirectoryAndOfEmptyAreasHasNothing) {
  std::filesystem::create_directories(data_.root());
  EXPECT_THAT(found(), IsEmpty());
  EXPECT_EQ(layout_.kind, Layout::Kind::Empty);
  std::filesystem::create_directories(data_.path("caches"));
  EXPECT_THAT(found(), IsEmpty());
  EXPECT_EQ(layout_.kind, Layout::Kind::Root);
}

TEST_F(LayoutTest, OfSomethingElseIsAnInputErrorThatSaysWhy) {
  data_.putFile("pictures/2023/sunrise.jpg", "x");
  EXPECT_THAT(complaint(data_.root()), HasSubstr("' is not a storage root or a part of one"));
  EXPECT_EQ(complaint(data_.path("nothing")), "ROOT '" + data_.path("nothing") + "' does not exist");
  EXPECT_EQ(complaint(data_.path("pictures/2023/sunrise.jpg")),
            "ROOT '" + data_.path("pictures/2023/sunrise.jpg") + "' is not a directory");
}

TEST_F(LayoutTest, OfARootInWhichNothingWasAskedForHasNothing) {
  data_.putFile("_cellar_lock", "");
  EXPECT_THAT(found(), IsEmpty());
  EXPECT_EQ(layout_.kind, Layout::Kind::Root);
}

TEST_F(LayoutTest, FollowsNoLinksBelowTheRoot) {
  data_.makeStore("caches/_sessionlessStore/thumbs_v1");
  std::filesystem::create_directory_symlink(data_.path("caches/_sessionlessStore/thumbs_v1"),
                                            data_.path("caches/_sessionlessStore/link_v1"));
  EXPECT_THAT(found(), ElementsAre("caches/_sessionlessStore: thumbs_v1+"));
}

// --- Names and definitions ---

class ConfiguredStoresTest : public testing::Test {
 protected:
  // The identifier, with "!" for another version; "-" for none.
  std::string find(const std::string& directory, const std::string& manager = "_sessionlessStore",
                   const std::string& area = "caches") const {
    ManagerPlace place;
    place.name = manager;
    place.area = area;
    const ConfiguredStore found = configured_.find(place, directory);
    if (found.definition == nullptr) return "-";
    return found.identifier + (found.hasItsVersion ? "" : "!");
  }

  const test::TemporaryDirectory directory_;
  const ConfiguredStores configured_{directory_.write("configuration.json", R"({
    "media": { "area": "caches", "session_scoped": false, "stores": {
      "thumbs": { "type": "disk_cache" },
      "thumbs_big": { "type": "disk_cache" },
      "letters": { "type": "pkvs", "locale_sensitive": true, "has_version": true, "version": 3 },
      "fonts": { "type": "unmanaged", "has_version": true, "version": 2 } } },
    "user": { "area": "documents", "session_scoped": true, "stores": { "drafts": { "type": "pkvs", "has_version": true } } }
  })")};
};

TEST_F(ConfiguredStoresTest, AreFoundWhateverTagAndLocaleAre) {
  EXPECT_EQ(find("thumbs_250_v1"), "thumbs");
  EXPECT_EQ(find("thumbs_1_2_3_v1"), "thumbs");
  EXPECT_EQ(find("thumbs_big_250_v1"), "thumbs_big");
  EXPECT_EQ(find("letters_en_US_v3"), "letters");
  EXPECT_EQ(find("fonts_v2"), "fonts");
}

TEST_F(ConfiguredStoresTest, AreToldFromOtherVersionsAndOtherNames) {
  EXPECT_EQ(find("fonts_v1"), "fonts!");
  EXPECT_EQ(find("letters_en_US_v12"), "letters!");
  EXPECT_EQ(find("fonts_250_v2"), "-");
  EXPECT_EQ(find("letters_v3"), "-");
  EXPECT_EQ(find("letters_en_v3"), "-");
  EXPECT_EQ(find("thumbs_v1"), "-");
  EXPECT_EQ(find("thumbs"), "-");
  EXPECT_EQ(find("fonts_v2x"), "-");
}

TEST_F(ConfiguredStoresTest, BelongToTheirAreaAndScope) {
  EXPECT_EQ(find("drafts_v1", "_store_alice", "documents"), "drafts");
  EXPECT_EQ(find("drafts_v1", "_sessionlessStore", "documents"), "-");
  EXPECT_EQ(find("drafts_v1", "_store_alice", "caches"), "-");
  EXPECT_EQ(find("drafts_v1", "_store_alice", "Application Support"), "drafts");
  EXPECT_EQ(find("drafts_v1", "", "anywhere"), "drafts");
}

TEST_F(ConfiguredStoresTest, ThatCannotBeReadAreAnInputErrorThatNamesTheFile) {
  const std::string missing = directory_.file("missing.json");
  const std::string broken = directory_.write("broken.json", "{");
  for (const std::string& file : {missing, broken}) {
    try {
      const ConfiguredStores configured(file);
      FAIL() << file;
    } catch (const InputError& error) {
      EXPECT_THAT(error.what(), HasSubstr(file));
    }
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
