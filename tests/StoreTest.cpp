#include "Store.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <limits>
#include <memory>
#include <stdexcept>
#include <string>

#include "Configuration.h"
#include "support/FakeStore.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;

std::shared_ptr<const StoreDefinition> definition(unsigned int maxSize, bool isCache) {
  return std::make_shared<UnmanagedStoreDefinition>("blob", "media", false, false, 1U, maxSize, isCache);
}

std::shared_ptr<Store> create(const std::shared_ptr<const StoreDefinition>& storeDefinition, const string& path) {
  return storeDefinition->createStore(path, "/unused", nullptr, nullptr, nullptr, nullptr, nullptr,
                                      PruneStrategyIdentifier::Null, storeDefinition);
}

// A store that prunes nothing of its own and knows itself.
class PlainStore : public Store {
 public:
  using Store::Store;
  bool isPrunable() override { return true; }
  void invalidate() override {}
};

TEST(Store, KeepsThePathAsItWasGiven) {
  EXPECT_EQ(UnmanagedStore("/a//b/", definition(0, false)).path, "/a//b/");
  EXPECT_EQ(UnmanagedStore("", definition(0, false)).path, "");
}

TEST(Store, AStoreThatDoesNotPruneThrowsAndCallsNobody) {
  PlainStore store("/a");
  Store& base = store;
  for (const bool survivalMode : {false, true}) {
    try {
      base.pruneBackToNormal([] { FAIL(); }, [](const std::exception&) { FAIL(); }, survivalMode);
      FAIL();
    } catch (const std::logic_error& error) {
      EXPECT_STREQ(error.what(), "pruneBackToNormal not implemented or invalid call");
    }
  }
}

TEST(Store, HandsOutWeakPointersToItselfAsTheTypeItIs) {
  const auto store = std::make_shared<PlainStore>("/a");
  EXPECT_EQ(store->weak_from_this<PlainStore>().lock(), store);
  EXPECT_EQ(store->weak_from_this<Store>().lock(), store);
  EXPECT_EQ(store->weak_from_this().lock(), store);
}

TEST(Store, AWeakPointerAsATypeThatItIsNotIsEmpty) {
  const auto store = std::make_shared<PlainStore>("/a");
  EXPECT_EQ(store->weak_from_this<UnmanagedStore>().lock(), nullptr);
}

TEST(Store, AStoreThatNoSharedPointerOwnsHasNoWeakPointer) {
  PlainStore store("/a");
  EXPECT_TRUE(store.weak_from_this<PlainStore>().expired());
}

TEST(UnmanagedStore, IsNeverPrunableNotEvenAsACache) {
  for (const bool isCache : {false, true}) {
    EXPECT_FALSE(UnmanagedStore("/a", definition(0, isCache)).isPrunable());
    EXPECT_FALSE(UnmanagedStore("/a", definition(1, isCache)).isPrunable());
  }
}

TEST(UnmanagedStore, ItsLimitIsTheDefinitions) {
  const auto largest = std::numeric_limits<unsigned int>::max();
  EXPECT_EQ(UnmanagedStore("/a", definition(0, false)).getMaxSize(), 0U);
  EXPECT_EQ(UnmanagedStore("/a", definition(largest, true)).getMaxSize(), largest);
}

TEST(UnmanagedStore, WithoutAConfiguredLimitItIsZero) {
  const Configuration configuration(R"({"media":{"stores":{"blob":{"type":"unmanaged"}}}})");
  const auto store = std::dynamic_pointer_cast<UnmanagedStore>(create(configuration.getStore("blob"), "/a"));
  ASSERT_NE(store, nullptr);
  EXPECT_EQ(store->getMaxSize(), 0U);
}

TEST(UnmanagedStore, PruningItIsAProgrammingError) {
  UnmanagedStore store("/a", definition(1, true));
  try {
    store.pruneBackToNormal([] { FAIL(); }, [](const std::exception&) { FAIL(); }, false);
    FAIL();
  } catch (const std::logic_error& error) {
    EXPECT_STREQ(error.what(), "pruneBackToNormal not implemented or invalid call");
  }
}

TEST(UnmanagedStore, InvalidatingItChangesNothing) {
  const test::TemporaryDirectory directory;
  directory.write("store/file", "bytes");
  UnmanagedStore store(directory.file("store"), definition(3, true));
  store.invalidate();
  store.invalidate();
  EXPECT_EQ(store.getMaxSize(), 3U);
  EXPECT_EQ(store.path, directory.file("store"));
  EXPECT_TRUE(directory.exists("store/file"));
}

TEST(UnmanagedStore, KeepsItsDefinitionAliveAfterTheConfigurationIsGone) {
  auto configuration = std::make_unique<Configuration>(
      R"({"media":{"stores":{"blob":{"type":"unmanaged","max_size":"5KB","is_cache":true}}}})");
  std::weak_ptr<const StoreDefinition> kept = configuration->getStore("blob");
  auto store = std::dynamic_pointer_cast<UnmanagedStore>(create(kept.lock(), "/a"));
  configuration.reset();
  EXPECT_FALSE(kept.expired());
  EXPECT_EQ(store->getMaxSize(), 5120U);
  store.reset();
  EXPECT_TRUE(kept.expired());
}

TEST(UnmanagedStore, IsCreatedByItsDefinitionFromPathAndDefinitionAlone) {
  const test::TemporaryDirectory directory;
  const auto storeDefinition = definition(12, true);
  const auto store = create(storeDefinition, directory.file("absent"));
  ASSERT_NE(std::dynamic_pointer_cast<UnmanagedStore>(store), nullptr);
  EXPECT_EQ(store->path, directory.file("absent"));
  EXPECT_FALSE(directory.exists("absent"));  // its directory is the manager's to create
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
