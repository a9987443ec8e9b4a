#include "StoreDirectoryNameBuilder.h"

#include <gtest/gtest.h>

#include <limits>
#include <memory>
#include <string>
#include <vector>

#include "Configuration.h"
#include "support/GroupingLocale.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;

UnmanagedStoreDefinition definition(const string& name, bool localeSensitive, bool hasVersion, unsigned int version) {
  return {name, "media", localeSensitive, hasVersion, version, 0U, false};
}

StoreManagerDefinition manager(bool sessionScoped) { return {"media", Area::Caches, 0, 0, {}, sessionScoped}; }

const std::vector<string> kNames{"_store_1", "_sessionlessStore", "_store", "x_store_2", "_store_"};

// A scheme of a host's own.
class UpperCaseNames : public StoreDirectoryNameBuilder {
 public:
  using StoreDirectoryNameBuilder::StoreDirectoryNameBuilder;
  string buildStoreManagerName() const override { return "MANAGER"; }
  bool hasStaleNamesInParent(const StoreManagerDefinition& /*manager*/) const override { return true; }
  std::vector<string> filterStoreManagerNames(const StoreManagerDefinition& /*manager*/,
                                              const std::vector<string>& /*names*/) const override {
    return {"OLD"};
  }
  string buildStoreName(const StoreDefinition& store) const override { return "STORE-" + store.name; }
};

class StoreDirectoryNameBuilderTest : public testing::Test {
 protected:
  const StoreDirectoryNameBuilderFactory factory_{"250", "US", "en"};
  const std::shared_ptr<StoreDirectoryNameBuilder> session_ = factory_.createStoreDirectoryNameBuilder("42");
  const std::shared_ptr<StoreDirectoryNameBuilder> sessionless_ = factory_.createStoreDirectoryNameBuilder();
};

TEST_F(StoreDirectoryNameBuilderTest, ManagersAreNamedAfterTheirSession) {
  EXPECT_EQ(session_->buildStoreManagerName(), "_store_42");
  EXPECT_EQ(sessionless_->buildStoreManagerName(), "_sessionlessStore");
}

TEST_F(StoreDirectoryNameBuilderTest, AnEmptySessionTagIsATagToo) {
  const auto builder = factory_.createStoreDirectoryNameBuilder("");
  EXPECT_EQ(builder->buildStoreManagerName(), "_store_");
  EXPECT_TRUE(builder->hasStaleNamesInParent(manager(false)));
}

TEST_F(StoreDirectoryNameBuilderTest, StoresAreNamedAfterLocaleAndVersion) {
  for (const auto& builder : {session_, sessionless_}) {
    EXPECT_EQ(builder->buildStoreName(definition("thumbs", false, false, 1)), "thumbs_250_v1");
    EXPECT_EQ(builder->buildStoreName(definition("thumbs", false, true, 3)), "thumbs_v3");
    EXPECT_EQ(builder->buildStoreName(definition("thumbs", true, false, 1)), "thumbs_en_US_250_v1");
    EXPECT_EQ(builder->buildStoreName(definition("thumbs", true, true, 2)), "thumbs_en_US_v2");
  }
}

TEST_F(StoreDirectoryNameBuilderTest, EmptyLocaleTagsKeepTheirSeparators) {
  const StoreDirectoryNameBuilder builder("250", "", "");
  EXPECT_EQ(builder.buildStoreName(definition("a_b", true, false, 1)), "a_b___250_v1");
}

TEST_F(StoreDirectoryNameBuilderTest, AnEmptyVersionTagKeepsItsSeparator) {
  const StoreDirectoryNameBuilder builder("", "US", "en");
  EXPECT_EQ(builder.buildStoreName(definition("thumbs", false, false, 1)), "thumbs__v1");
  EXPECT_EQ(builder.buildStoreName(definition("thumbs", false, true, 1)), "thumbs_v1");
}

TEST_F(StoreDirectoryNameBuilderTest, AnEmptyNameIsKeptAsItIs) {
  EXPECT_EQ(session_->buildStoreName(definition("", false, true, 1)), "_v1");
}

TEST_F(StoreDirectoryNameBuilderTest, VersionsAreUnsigned) {
  EXPECT_EQ(session_->buildStoreName(definition("a", false, true, 0)), "a_v0");
  EXPECT_EQ(session_->buildStoreName(definition("a", false, true, std::numeric_limits<unsigned int>::max())),
            "a_v4294967295");
}

TEST_F(StoreDirectoryNameBuilderTest, VersionsDoNotDependOnTheProcessesLocale) {
  const test::GroupingLocale locale;
  EXPECT_EQ(session_->buildStoreName(definition("a", true, false, 1234567)), "a_en_US_250_v1234567");
}

TEST_F(StoreDirectoryNameBuilderTest, TheSessionTagDoesNotNameStores) {
  const auto other = factory_.createStoreDirectoryNameBuilder("43");
  EXPECT_EQ(other->buildStoreName(definition("a", true, false, 1)),
            session_->buildStoreName(definition("a", true, false, 1)));
}

TEST_F(StoreDirectoryNameBuilderTest, OnlySessionBuildersExpectOtherSessionsDirectories) {
  for (const bool sessionScoped : {false, true}) {
    EXPECT_TRUE(session_->hasStaleNamesInParent(manager(sessionScoped)));
    EXPECT_FALSE(sessionless_->hasStaleNamesInParent(manager(sessionScoped)));
  }
}

TEST_F(StoreDirectoryNameBuilderTest, FilteringKeepsWhatBeginsWithThePrefix) {
  for (const auto& builder : {session_, sessionless_}) {
    EXPECT_EQ(builder->filterStoreManagerNames(manager(true), kNames), (std::vector<string>{"_store_1", "_store_"}));
  }
}

TEST_F(StoreDirectoryNameBuilderTest, FilteringKeepsOrderDuplicatesAndTheOwnName) {
  const std::vector<string> names{"_store_9", "_store_42", "", "_STORE_1", "_store_9", "_store_a/b"};
  EXPECT_EQ(session_->filterStoreManagerNames(manager(false), names),
            (std::vector<string>{"_store_9", "_store_42", "_store_9", "_store_a/b"}));
}

TEST_F(StoreDirectoryNameBuilderTest, FilteringNothingGivesNothing) {
  EXPECT_TRUE(session_->filterStoreManagerNames(manager(true), {}).empty());
}

TEST_F(StoreDirectoryNameBuilderTest, TheConstructorsAreWhatTheFactoryUses) {
  const StoreDirectoryNameBuilder sessionless("1", "B", "A");
  const StoreDirectoryNameBuilder session("1", "B", "A", "s");
  EXPECT_EQ(sessionless.buildStoreManagerName(), "_sessionlessStore");
  EXPECT_EQ(session.buildStoreManagerName(), "_store_s");
  EXPECT_EQ(session.buildStoreName(definition("x", true, false, 4)), "x_A_B_1_v4");
  EXPECT_EQ(sessionless.buildStoreName(definition("x", true, false, 4)), "x_A_B_1_v4");
}

TEST_F(StoreDirectoryNameBuilderTest, BuildersOutliveTheirFactory) {
  auto factory = std::make_unique<StoreDirectoryNameBuilderFactory>("7", "US", "en");
  const auto builder = factory->createStoreDirectoryNameBuilder("s");
  factory.reset();
  EXPECT_EQ(builder->buildStoreName(definition("x", false, false, 1)), "x_7_v1");
}

TEST_F(StoreDirectoryNameBuilderTest, AHostMaySupplyItsOwnScheme) {
  const std::shared_ptr<StoreDirectoryNameBuilder> builder = std::make_shared<UpperCaseNames>("1", "US", "en");
  EXPECT_EQ(builder->buildStoreManagerName(), "MANAGER");
  EXPECT_TRUE(builder->hasStaleNamesInParent(manager(false)));
  EXPECT_EQ(builder->filterStoreManagerNames(manager(false), kNames), std::vector<string>{"OLD"});
  EXPECT_EQ(builder->buildStoreName(definition("x", false, false, 1)), "STORE-x");
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
