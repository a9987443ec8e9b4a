// A link that somebody plants in the place of a directory while it is being deleted or measured.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cinttypes>
#include <cstdint>
#include <cstdio>
#include <filesystem>
#include <memory>
#include <random>
#include <string>

#include "AttributeStore.h"
#include "DiskSizeCalculator.h"
#include "TrashCollector.h"
#include "host/testing/FaultyFileUtils.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using test::Operation;
using testing::ElementsAre;

class APlantedLink : public testing::Test {
 protected:
  APlantedLink() {
    for (const char* file : {"outside/one", "outside/two", "outside/deep/three", "tree/sub/one", "tree/sub/two"}) {
      directory_.write(file, "12345");
    }
  }

  // As soon as that operation is asked for on the directory "sub", a link to the outside stands in its place.
  void plantAt(Operation operation) {
    files_->onCall = [this, operation](Operation asked, const string& path) {
      if (asked != operation || files_->basename(path) != "sub" || isPlanted_) return;
      isPlanted_ = true;
      std::filesystem::rename(path, directory_.file("moved"));
      std::filesystem::create_symlink(directory_.file("outside"), path);
    };
  }

  void expectTheOutsideIsUntouched() const {
    EXPECT_TRUE(isPlanted_);
    EXPECT_THAT(directory_.names("outside"), ElementsAre("deep", "one", "two"));
    EXPECT_THAT(directory_.names("outside/deep"), ElementsAre("three"));
  }

  string tree() const { return directory_.file("tree"); }

  test::TemporaryDirectory directory_;
  std::shared_ptr<test::FaultyFileUtils> files_ = std::make_shared<test::FaultyFileUtils>();
  test::ManualQueueFactory queues_;
  bool isPlanted_ = false;
};

class APlantedLinkMetBy : public APlantedLink, public testing::WithParamInterface<Operation> {};

TEST_P(APlantedLinkMetBy, APassOverTheTrashIsDeletedAsALink) {
  const auto queues = std::make_shared<test::ManualQueueFactory>();
  TrashCollector collector(directory_.file("trash"), files_, nullptr, queues);
  ASSERT_TRUE(collector.collectPath(tree()));
  plantAt(GetParam());
  queues->runAll();
  expectTheOutsideIsUntouched();
  EXPECT_FALSE(directory_.exists("trash"));
}

TEST_P(APlantedLinkMetBy, ADeletionByPredicateIsDeletedAsALink) {
  TrashCollector collector(directory_.file("trash"), files_, nullptr, nullptr);
  plantAt(GetParam());
  EXPECT_TRUE(collector.removeFilesWithFilter(tree(), [](const string&) { return true; }));
  expectTheOutsideIsUntouched();
  EXPECT_FALSE(directory_.exists("tree"));
}

TEST_P(APlantedLinkMetBy, AMeasurementIsNeitherCountedNorWrittenThrough) {
  DiskSizeCalculator calculator(files_, std::make_shared<AttributeStore>(files_), nullptr);
  plantAt(GetParam());
  EXPECT_EQ(calculator.calculateDirectorySize(tree()).size, 0);
  expectTheOutsideIsUntouched();
}

INSTANTIATE_TEST_SUITE_P(Moments, APlantedLinkMetBy, testing::Values(Operation::ListDirectory, Operation::IsSymLink),
                         [](const auto& moment) {
                           return moment.param == Operation::IsSymLink ? "AtTheLastLook" : "BetweenListings";
                         });

TEST_F(APlantedLink, MetByTheDeletionOfATreeIsDeletedAsALink) {
  plantAt(Operation::RecursiverDirectoryDelete);
  files_->recursiverDirectoryDelete(tree());
  expectTheOutsideIsUntouched();
  EXPECT_FALSE(directory_.exists("tree"));
}

TEST_F(APlantedLink, UnderTheNextNameInTheTrashIsLeftAloneThoughItLeadsNowhere) {
  const test::ManualClock clock(1'234'567);
  std::mt19937_64 random(1'234'567U);
  char name[17];
  ASSERT_EQ(std::snprintf(name, sizeof name, "%016" PRIx64, static_cast<std::uint64_t>(random())), 16);
  directory_.makeDirectory("trash");
  std::filesystem::create_symlink("nowhere", directory_.file("trash/" + string(name)));
  directory_.write("file", "");

  const auto queues = std::make_shared<test::ManualQueueFactory>();
  TrashCollector collector(directory_.file("trash"), files_, nullptr, queues);
  EXPECT_TRUE(collector.collectPath(directory_.file("file")));
  EXPECT_TRUE(std::filesystem::is_symlink(directory_.file("trash/" + string(name))));
  EXPECT_EQ(directory_.names("trash").size(), 2U);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
