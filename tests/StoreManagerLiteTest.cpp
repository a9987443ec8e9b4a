#include "StoreManagerLite.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <functional>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "LarderException.h"
#include "Store.h"
#include "support/Barrier.h"
#include "support/IncidentLog.h"
#include "support/LogCapture.h"
#include "support/ManagerServices.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;

class StoreManagerLiteTest : public testing::Test, protected test::ManagerServices {
 protected:
  StoreManagerLite& build(Stores definitions) {
    lite_ = std::make_unique<StoreManagerLite>(areaPath(), manager(std::move(definitions)), files,
                                               names.createStoreDirectoryNameBuilder("1"), trash, attributes);
    return *lite_;
  }

  string thrownText(const std::function<void()>& operation) {
    try {
      operation();
    } catch (const std::logic_error& error) {
      return error.what();
    }
    return "nothing thrown";
  }

  std::unique_ptr<StoreManagerLite> lite_;
  test::LogCapture log_;
};

const string kUnknown = "Definition not defined for store with identifier x in StoreManager with name 'media'";

TEST_F(StoreManagerLiteTest, ConstructionRenewsTheTemporaryDirectoryAndDoesNothingElse) {
  directory.write("area/_store_1/tmp/left", "bytes");
  directory.makeDirectory("area/_store_1/old_1_v1");
  directory.makeDirectory("area/_store_2");
  build({{"a", unmanaged("a", 1, true)}});
  EXPECT_EQ(trash->collected(), std::vector<string>{areaPath() + "/_store_1/tmp"});
  EXPECT_TRUE(directory.names("area/_store_1/tmp").empty());
  EXPECT_TRUE(directory.exists("area/_store_1/old_1_v1"));
  EXPECT_TRUE(directory.exists("area/_store_2"));
  EXPECT_FALSE(directory.exists("area/_store_1/a_250_v1"));
  EXPECT_TRUE(lite_->isValid());
}

TEST_F(StoreManagerLiteTest, HandsOutUnmanagedStoresAndAlwaysTheSame) {
  build({{"a", unmanaged("a", 9)}});
  const auto store = lite_->getStoreImpl("a");
  ASSERT_NE(std::dynamic_pointer_cast<UnmanagedStore>(store), nullptr);
  EXPECT_EQ(store->path, areaPath() + "/_store_1/a_250_v1");
  EXPECT_TRUE(directory.exists("area/_store_1/a_250_v1"));
  EXPECT_EQ(lite_->getStoreImpl("a"), store);
}

TEST_F(StoreManagerLiteTest, AnOversizedCacheIsLeftAlone) {
  directory.write("area/_store_1/a_250_v1/file", string(100, 'x'));
  build({{"a", unmanaged("a", 1, true)}});
  lite_->getStoreImpl("a");
  EXPECT_TRUE(directory.exists("area/_store_1/a_250_v1/file"));
  EXPECT_TRUE(sizes->fetched().empty());
}

TEST_F(StoreManagerLiteTest, TellsOfAStoreThatCannotBeCreated) {
  const test::IncidentLog incidents;
  build({{"a", unmanaged("a")}}).setIncidents(incidents.reporter);
  files->failPath(test::Operation::CreateDirectory, areaPath() + "/_store_1/a_250_v1", EIO);
  EXPECT_THROW(lite_->getStoreImpl("a"), FileUtilsIoException);
  EXPECT_THROW(lite_->getStoreImpl("x"), std::logic_error);
  EXPECT_EQ(incidents.queue->runAll(), 1U);
}

TEST_F(StoreManagerLiteTest, StoresGetNoServicesAndTheNullStrategy) {
  build({{"a", fake("a", {0, false})}});
  lite_->getStoreImpl("a");
  ASSERT_EQ(stores->creations().size(), 1U);
  const test::Creation creation = stores->creations()[0];
  EXPECT_EQ(creation.taskQueueFactory, nullptr);
  EXPECT_EQ(creation.trashCollector, nullptr);
  EXPECT_EQ(creation.analyticsReporter, nullptr);
  EXPECT_FALSE(creation.hasSizeCallback);
  EXPECT_EQ(creation.fileUtils, files.get());
  EXPECT_EQ(creation.pruneStrategy, PruneStrategyIdentifier::Null);
  lite_->invalidate();
}

TEST_F(StoreManagerLiteTest, AHostsOwnKindOfManagedStoreIsCreated) {
  build({{"a", fake("a", {0, true})}});
  EXPECT_NE(lite_->getStoreImpl("a"), nullptr);
  lite_->invalidate();
}

TEST_F(StoreManagerLiteTest, AnUnknownIdentifierThrowsEachTimeAndHangsNobody) {
  build({});
  EXPECT_EQ(thrownText([&] { lite_->getStoreImpl("x"); }), kUnknown);
  EXPECT_EQ(thrownText([&] { lite_->getStoreImpl("x"); }), kUnknown);
}

TEST_F(StoreManagerLiteTest, AManagedStoreIsRefusedEachTimeAndHangsNobody) {
  build({{"kv", std::make_shared<PKVSDefinition>("kv", "media", false, false, 1U, std::nullopt, false, 1U)},
         {"dc", std::make_shared<DiskCacheDefinition>("dc", "media", false, false, 1U, std::nullopt, 1U, false, 1U, 1U,
                                                      ExtendedMetadataFactoryIdentifier::Null,
                                                      PruneStrategyIdentifier::LRU)}});
  for (const string identifier : {"kv", "kv", "dc", "dc"}) {
    EXPECT_EQ(thrownText([&] { lite_->getStoreImpl(identifier); }),
              "Store '" + identifier + "' needs a task queue factory, which a lite manager has not.");
  }
  EXPECT_FALSE(directory.exists("area/_store_1/kv_250_v1"));
  EXPECT_FALSE(directory.exists("area/_store_1/dc_250_v1"));
}

TEST_F(StoreManagerLiteTest, AfterInvalidatingThereAreNoStoresAndNoData) {
  build({{"a", unmanaged("a")}});
  lite_->getStoreImpl("a");
  lite_->invalidate();
  EXPECT_FALSE(lite_->isValid());
  EXPECT_EQ(lite_->getStoreImpl("a"), nullptr);
  EXPECT_FALSE(directory.exists("area/_store_1"));
  lite_->invalidate();
  EXPECT_EQ(trash->collected(), std::vector<string>{areaPath() + "/_store_1"});
}

TEST_F(StoreManagerLiteTest, AfterInvalidatingAnUnknownIdentifierIsNoErrorEither) {
  build({});
  lite_->invalidate();
  EXPECT_EQ(lite_->getStoreImpl("x"), nullptr);
}

TEST_F(StoreManagerLiteTest, AMarkedStoreIsTrashedWithTheManagersOwnCollector) {
  directory.write("area/_store_1/a_250_v1/value", "bytes");
  attributes->set(areaPath() + "/_store_1/a_250_v1", {{"trash_on_start_up", true}});
  build({{"a", unmanaged("a")}});
  lite_->getStoreImpl("a");
  EXPECT_EQ(trash->collected(), std::vector<string>{areaPath() + "/_store_1/a_250_v1"});
  EXPECT_TRUE(directory.names("area/_store_1/a_250_v1").empty());
}

TEST_F(StoreManagerLiteTest, ManyThreadsGetTheSameStore) {
  build({{"a", unmanaged("a")}});
  std::vector<std::shared_ptr<Store>> got(6);
  test::runOnThreads(got.size(), [&](std::size_t thread) { got[thread] = lite_->getStoreImpl("a"); });
  for (const auto& store : got) EXPECT_EQ(store, got[0]);
  EXPECT_NE(got[0], nullptr);
}

TEST_F(StoreManagerLiteTest, DestroyingTheManagerFreesItAndItsStoresAndKeepsTheData) {
  build({{"a", unmanaged("a")}});
  const std::weak_ptr<Store> kept = lite_->getStoreImpl("a");
  lite_.reset();
  EXPECT_TRUE(kept.expired());
  EXPECT_TRUE(directory.exists("area/_store_1/a_250_v1"));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
