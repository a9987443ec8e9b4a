#include "StoreManagerFactory.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <functional>
#include <future>
#include <memory>
#include <mutex>
#include <stdexcept>
#include <string>
#include <thread>
#include <unordered_map>
#include <utility>
#include <vector>

#include "LarderException.h"
#include "LazyDispatcher.h"
#include "PathLocations.h"
#include "StoreManager.h"
#include "support/Barrier.h"
#include "support/IncidentLog.h"
#include "support/LogCapture.h"
#include "support/ManagerServices.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using test::FakeStore;
using test::Latch;
using test::Operation;
using Texts = std::vector<string>;

const string kNotInContainer = "Invalid manager identifier: manager definition not in container.";

// Areas under one root; remembers what it was asked, and does what the test wants meanwhile.
class FakeLocations : public PathLocations {
 public:
  explicit FakeLocations(string root) : root_(std::move(root)) {}

  std::function<void(Area area, const string& sessionKey)> onCall;

  string pathForArea(Area area, const string& sessionKey) override {
    {
      const std::lock_guard<std::mutex> lock(mutex_);
      calls_.emplace_back(area, sessionKey);
    }
    if (onCall) onCall(area, sessionKey);
    return root_ + "/" + std::to_string(static_cast<int>(area));
  }

  std::vector<std::pair<Area, string>> calls() const {
    const std::lock_guard<std::mutex> lock(mutex_);
    return calls_;
  }

 private:
  const string root_;
  mutable std::mutex mutex_;  // guards the calls
  std::vector<std::pair<Area, string>> calls_;
};

// A host's own source of definitions, which answers with nothing for some names.
class HostConfiguration : public Configuration {
 public:
  HostConfiguration() : Configuration(std::unordered_map<string, std::shared_ptr<const StoreManagerDefinition>>()) {}
  std::shared_ptr<const StoreDefinition> getStore(const string& /*identifier*/) const override {
    throw std::runtime_error("the host's own words");
  }
  std::shared_ptr<const StoreManagerDefinition> getManager(const string& /*name*/) const override { return nullptr; }
};

class StoreManagerFactoryTest : public testing::Test, protected test::ManagerServices {
 protected:
  using Definitions = std::unordered_map<string, std::shared_ptr<const StoreManagerDefinition>>;

  void TearDown() override {
    StoreManager::setForceCleanseOnInit(false);
    for (const auto& manager : got_) {
      if (manager != nullptr) manager->invalidate();
    }
    for (const auto& queue : queues->all()) queue->dropAll();
  }

  void define(const string& name, Stores definitions = {}, bool sessionScoped = true, Area area = Area::Caches) {
    definitions_[name] = std::make_shared<StoreManagerDefinition>(
        StoreManagerDefinition{name, area, 0, 1, std::move(definitions), sessionScoped});
  }

  std::shared_ptr<StoreManagerFactory> build(bool servesSessionScoped = true,
                                             const std::function<string(const string&)>& mapper = nullptr) {
    if (configuration_ == nullptr) configuration_ = std::make_shared<Configuration>(definitions_);
    factory_ = std::make_shared<StoreManagerFactory>(
        servesSessionScoped, reporter, attributes, configuration_, sizes, files, dispatcher_, locations_,
        std::make_shared<StoreDirectoryNameBuilderFactory>(names), queues, trash, mapper);
    return factory_;
  }

  // Asks for a manager, and sees to its end.
  std::shared_ptr<StoreManager> get(const string& name, const string& sessionKey = "", bool runMaintenance = true) {
    return keep(factory_->managerForIdentifier(name, sessionKey, runMaintenance));
  }
  std::shared_ptr<StoreManager> keep(std::shared_ptr<StoreManager> manager) {
    const std::lock_guard<std::mutex> lock(gotMutex_);
    got_.push_back(manager);
    return manager;
  }

  static bool isBrokenPromise(const std::function<void()>& operation) {
    try {
      operation();
    } catch (const std::future_error& error) {
      return error.code() == std::future_errc::broken_promise;
    }
    return false;
  }

  string managerPath(const string& directoryName, Area area = Area::Caches) const {
    return directory.file("areas/" + std::to_string(static_cast<int>(area)) + "/" + directoryName);
  }

  Definitions definitions_;
  std::shared_ptr<const Configuration> configuration_;
  std::shared_ptr<FakeLocations> locations_ = std::make_shared<FakeLocations>(directory.file("areas"));
  std::shared_ptr<LazyDispatcher> dispatcher_;
  std::shared_ptr<StoreManagerFactory> factory_;
  std::mutex gotMutex_;
  std::vector<std::shared_ptr<StoreManager>> got_;
  test::LogCapture log_;
};

// Building managers

TEST_F(StoreManagerFactoryTest, EveryRequestForANameGetsTheManagerOfTheFirst) {
  define("media");
  build();
  EXPECT_EQ(queues->queueCount(), 0U);  // nothing is built unasked
  const auto manager = get("media", "one", true);
  ASSERT_NE(manager, nullptr);
  EXPECT_EQ(get("media", "another", false), manager);
  EXPECT_EQ(factory_->managerForIdentifier("media"), manager);
  EXPECT_EQ(queues->queueCount(), 1U);
  EXPECT_EQ(locations_->calls().size(), 1U);
}

TEST_F(StoreManagerFactoryTest, ManagersOfDifferentNamesAreDifferent) {
  define("a", {}, true, Area::Caches);
  define("b", {}, true, Area::Documents);
  define("c", {}, true, Area::Shared);
  build();
  const auto a = get("a", "key");
  const auto b = get("b", "key");
  const auto c = get("c", "key");
  EXPECT_NE(a, b);
  EXPECT_NE(b, c);
  EXPECT_EQ(locations_->calls(), (std::vector<std::pair<Area, string>>{
                                     {Area::Caches, "key"}, {Area::Documents, "key"}, {Area::Shared, "key"}}));
  EXPECT_EQ(b->getTemporaryDirectory(), managerPath("_store_", Area::Documents) + "/tmp");
  EXPECT_EQ(c->getTemporaryDirectory(), managerPath("_store_", Area::Shared) + "/tmp");
}

TEST_F(StoreManagerFactoryTest, TheShortFormsMeanTheEmptyKeyWithMaintenance) {
  define("media", {{"s", std::make_shared<UnmanagedStoreDefinition>("s", "media", false, false, 1U, 0U, false)}});
  build();
  directory.makeDirectory("areas/0/_store_/old_1_v1");
  keep(factory_->managerForIdentifier("media"));
  EXPECT_EQ(locations_->calls(), (std::vector<std::pair<Area, string>>{{Area::Caches, ""}}));
  queues->queue(0)->runAll();
  EXPECT_EQ(trash->collected(), Texts{managerPath("_store_/old_1_v1")});
  factory_->invalidate();

  directory.makeDirectory("areas/0/_store_/old_2_v1");
  keep(factory_->managerForIdentifier("media", "", false));
  EXPECT_EQ(queues->queue(1)->pending(), 0U);
  factory_->invalidate();
  keep(factory_->managerForStoreIdentifier("s"));
  EXPECT_EQ(queues->queue(2)->pending(), 1U);
}

TEST_F(StoreManagerFactoryTest, SessionsAreNamedByTheMapper) {
  define("media");
  std::vector<string> mapped;
  build(true, [&](const string& key) {
    mapped.push_back(key);
    return "tag-of-" + key;
  });
  EXPECT_EQ(get("media", "alice")->getTemporaryDirectory(), managerPath("_store_tag-of-alice") + "/tmp");
  EXPECT_EQ(mapped, Texts{"alice"});
}

TEST_F(StoreManagerFactoryTest, WithoutAMapperTheSessionTagIsEmpty) {
  define("media");
  build();
  EXPECT_EQ(get("media", "alice")->getTemporaryDirectory(), managerPath("_store_") + "/tmp");
}

TEST_F(StoreManagerFactoryTest, AFactoryForNoSessionNamesItsDirectoryWithoutTheTag) {
  define("media", {}, false);
  build(false, [](const string& key) { return key; });
  EXPECT_EQ(get("media", "alice")->getTemporaryDirectory(), managerPath("_sessionlessStore") + "/tmp");
}

TEST_F(StoreManagerFactoryTest, ManagersGetTheFactorysServices) {
  dispatcher_ = LazyDispatcher::createLazyDispatcher(trashQueues, 1);
  define("media", {{"a", fake("a")}});
  build();
  const auto manager = get("media");
  EXPECT_EQ(queues->workQueueCount(), 1U);  // for lazy creation
  manager->getStoreImpl("a", PruneStrategyIdentifier::Null);
  ASSERT_EQ(stores->creations().size(), 1U);
  const test::Creation creation = stores->creations()[0];
  EXPECT_EQ(creation.taskQueueFactory, queues.get());
  EXPECT_EQ(creation.trashCollector, trash.get());
  EXPECT_EQ(creation.analyticsReporter, reporter.get());
  EXPECT_EQ(creation.fileUtils, files.get());
}

TEST_F(StoreManagerFactoryTest, AManagerBuiltWhileTheFlagIsSetIsCleansed) {
  define("a", {}, true, Area::Caches);
  define("b", {}, true, Area::Documents);
  directory.write("areas/0/_store_/value", "bytes");
  directory.write("areas/1/_store_/value", "bytes");
  build();
  StoreManager::setForceCleanseOnInit(true);
  get("a");
  EXPECT_FALSE(directory.exists("areas/0/_store_/value"));
  EXPECT_TRUE(StoreManager::forceCleanseOnInit());  // never reset by the library
  StoreManager::setForceCleanseOnInit(false);
  get("b");
  EXPECT_TRUE(directory.exists("areas/1/_store_/value"));
}

TEST_F(StoreManagerFactoryTest, ManagersReportIncidentsWhereTheFactorySays) {
  test::IncidentLog incidents;
  define("a", {{"thumbs", fake("thumbs")}});
  define("b", {}, true, Area::Documents);
  build();
  files->total = 1;
  get("b");
  factory_->setIncidents(incidents.reporter);
  const auto manager = get("a");
  ASSERT_EQ(incidents.queue->pending(), 1U);
  EXPECT_EQ(incidents.take().at(0).rfind("ManagerDiscarded " + directory.file("areas/0/_store_") + ": ", 0), 0U);
  stores->onCreate = [](const string&, const auto&) { throw FileUtilsIoException(EIO, "no luck"); };
  EXPECT_THROW(manager->getStoreImpl("thumbs", PruneStrategyIdentifier::Null), FileUtilsIoException);
  EXPECT_EQ(incidents.take().size(), 1U);
}

TEST_F(StoreManagerFactoryTest, AHandlerThatIsCalledAtOnceMayAskForTheManagerThatReports) {
  const test::Watchdog watchdog(60);
  test::IncidentLog incidents;
  std::shared_ptr<StoreManager> heard;
  incidents.runAtOnce();
  incidents.onIncident = [&](const Incident&) { heard = factory_->managerForIdentifier("a"); };
  define("a");
  build();
  factory_->setIncidents(incidents.reporter);
  files->total = 1;
  const auto manager = get("a");
  ASSERT_NE(heard, nullptr);
  EXPECT_EQ(heard, manager);
}

// Requests that fail

TEST_F(StoreManagerFactoryTest, AManagerOfTheOtherScopeIsRefusedOnceAndForAll) {
  configuration_ = std::make_shared<Configuration>(R"({"media":{}, "global":{"session_scoped":false}})");
  build(false);
  EXPECT_EQ(get("media"), nullptr);
  EXPECT_EQ(log_.messages(), Texts{kNotInContainer});
  EXPECT_EQ(log_.errorCount(), 1U);
  EXPECT_EQ(get("media", "key", false), nullptr);
  EXPECT_EQ(log_.messages().size(), 1U);
  EXPECT_EQ(queues->queueCount(), 0U);
  EXPECT_TRUE(locations_->calls().empty());
  EXPECT_NE(get("global"), nullptr);

  build(true);
  EXPECT_EQ(get("global"), nullptr);
  EXPECT_EQ(log_.messages(), (Texts{kNotInContainer, kNotInContainer}));
  EXPECT_NE(get("media"), nullptr);
}

TEST_F(StoreManagerFactoryTest, AHostsConfigurationWithoutADefinitionIsRefusedInTheSameWay) {
  configuration_ = std::make_shared<HostConfiguration>();
  build();
  EXPECT_EQ(get("media"), nullptr);
  EXPECT_EQ(log_.messages(), Texts{kNotInContainer});
  EXPECT_EQ(get("media"), nullptr);
  EXPECT_EQ(log_.messages().size(), 1U);
}

TEST_F(StoreManagerFactoryTest, AnUnknownNameThrowsFirstAndIsABrokenPromiseFromThenOn) {
  define("media");
  build();
  try {
    get("x");
    FAIL();
  } catch (const ConfigurationException& error) {
    EXPECT_STREQ(error.description(), "Manager 'x' not found.");
  }
  for (int i = 0; i < 3; ++i) EXPECT_TRUE(isBrokenPromise([&] { get("x"); }));
  EXPECT_NE(get("media"), nullptr);
}

TEST_F(StoreManagerFactoryTest, AnAreaThatIsNotAvailableGivesNothingQuietlyAndForGood) {
  define("media");
  locations_->onCall = [](Area, const string&) { throw std::runtime_error("no card"); };
  build();
  EXPECT_EQ(get("media"), nullptr);
  locations_->onCall = nullptr;
  EXPECT_EQ(get("media"), nullptr);
  EXPECT_EQ(locations_->calls().size(), 1U);
  EXPECT_TRUE(log_.messages().empty());
}

TEST_F(StoreManagerFactoryTest, AnAreaMayFailWithAnythingAtAll) {
  define("media");
  locations_->onCall = [](Area, const string&) { throw 42; };
  build();
  EXPECT_EQ(get("media"), nullptr);
}

TEST_F(StoreManagerFactoryTest, TheMapperIsNotAskedForAnAreaThatIsNotAvailable) {
  define("media");
  locations_->onCall = [](Area, const string&) { throw std::runtime_error("no card"); };
  build(true, [](const string& key) {
    ADD_FAILURE();
    return key;
  });
  EXPECT_EQ(get("media"), nullptr);
}

TEST_F(StoreManagerFactoryTest, AMapperThatThrowsReachesTheFirstCallerAndBreaksThePromise) {
  define("media");
  build(true, [](const string&) -> string { throw std::out_of_range("no such session"); });
  EXPECT_THROW(get("media"), std::out_of_range);
  EXPECT_TRUE(isBrokenPromise([&] { get("media"); }));
}

TEST_F(StoreManagerFactoryTest, AManagerThatCannotBeBuiltReachesTheFirstCallerAndBreaksThePromiseUntilInvalidate) {
  define("media");
  files->failNext(Operation::CreateDirectory, ENOSPC);
  build();
  EXPECT_THROW(get("media"), FileUtilsIoException);
  EXPECT_TRUE(isBrokenPromise([&] { get("media"); }));
  EXPECT_TRUE(isBrokenPromise([&] { factory_->invalidate(); }));
  EXPECT_NE(get("media"), nullptr);
}

// By store

TEST_F(StoreManagerFactoryTest, AStoresManagerIsTheManagerOfThatName) {
  configuration_ = std::make_shared<Configuration>(
      R"({"media":{"stores":{"thumbs":{"type":"unmanaged"}}}, "other":{"stores":{"blob":{"type":"unmanaged"}}}})");
  build();
  const auto manager = keep(factory_->managerForStoreIdentifier("thumbs", "key", false));
  ASSERT_NE(manager, nullptr);
  EXPECT_EQ(get("media"), manager);
  EXPECT_EQ(factory_->managerForStoreIdentifier("thumbs"), manager);
  EXPECT_NE(keep(factory_->managerForStoreIdentifier("blob")), manager);
  EXPECT_EQ(locations_->calls()[0].second, "key");
}

TEST_F(StoreManagerFactoryTest, AnUnknownStoreGivesNothingAndOneErrorLineEachTime) {
  define("media");
  build();
  EXPECT_EQ(factory_->managerForStoreIdentifier("x"), nullptr);
  EXPECT_EQ(factory_->managerForStoreIdentifier("x", "key", true), nullptr);
  const string line = ConfigurationException("Store 'x' not found.").what();
  EXPECT_EQ(log_.messages(), (Texts{line, line}));
  EXPECT_EQ(log_.errorCount(), 2U);
}

TEST_F(StoreManagerFactoryTest, AStoreOfAHostsConfigurationThatHasNoDefinitionIsLogged) {
  class WithoutDefinitions final : public HostConfiguration {
   public:
    std::shared_ptr<const StoreDefinition> getStore(const string& /*identifier*/) const override { return nullptr; }
  };
  configuration_ = std::make_shared<WithoutDefinitions>();
  build();
  EXPECT_EQ(factory_->managerForStoreIdentifier("x"), nullptr);
  EXPECT_EQ(log_.messages(), Texts{"Store 'x' has no definition."});
}

TEST_F(StoreManagerFactoryTest, WhateverLookingForTheStoreThrowsIsLogged) {
  configuration_ = std::make_shared<HostConfiguration>();
  build();
  EXPECT_EQ(factory_->managerForStoreIdentifier("x"), nullptr);
  EXPECT_EQ(log_.messages(), Texts{"the host's own words"});
}

TEST_F(StoreManagerFactoryTest, WhatGettingTheStoresManagerThrowsIsNotCaught) {
  // The store's definition names a manager that is not there.
  definitions_["media"] = std::make_shared<StoreManagerDefinition>(
      StoreManagerDefinition{"media", Area::Caches, 0, 1, {{"s", unmanaged("s")}}, true});  // of the manager "fakes"
  build();
  EXPECT_THROW(factory_->managerForStoreIdentifier("s"), ConfigurationException);
  EXPECT_TRUE(isBrokenPromise([&] { factory_->managerForStoreIdentifier("s"); }));
  EXPECT_TRUE(log_.messages().empty());
}

// Concurrent callers

TEST_F(StoreManagerFactoryTest, ManyThreadsThatAskAtOnceGetOneManager) {
  define("media");
  for (int round = 0; round < 30; ++round) {
    build();
    const std::size_t before = queues->queueCount();
    std::vector<std::shared_ptr<StoreManager>> managers(8);
    test::runOnThreads(managers.size(), [&](std::size_t thread) { managers[thread] = get("media"); });
    for (const auto& manager : managers) ASSERT_EQ(manager, managers[0]);
    ASSERT_NE(managers[0], nullptr);
    ASSERT_EQ(queues->queueCount(), before + 1);
  }
}

TEST_F(StoreManagerFactoryTest, WhileAManagerIsBeingBuiltOthersCanBeHad) {
  define("slow", {}, true, Area::Caches);
  define("other", {}, true, Area::Documents);
  Latch building(1);
  Latch release(1);
  locations_->onCall = [&](Area area, const string&) {
    if (area != Area::Caches) return;
    building.countDown();
    release.wait();
  };
  build();
  std::shared_ptr<StoreManager> slow;
  std::thread creator([&] { slow = get("slow"); });
  building.wait();
  EXPECT_NE(get("other"), nullptr);
  std::shared_ptr<StoreManager> waited;
  std::thread waiter([&] { waited = get("slow"); });
  release.countDown();
  creator.join();
  waiter.join();
  EXPECT_NE(slow, nullptr);
  EXPECT_EQ(waited, slow);
  EXPECT_EQ(locations_->calls().size(), 2U);
}

TEST_F(StoreManagerFactoryTest, NoLockIsHeldWhileAManagerIsBuilt) {
  define("outer", {}, true, Area::Caches);
  define("inner", {}, true, Area::Documents);
  std::shared_ptr<StoreManager> inner;
  locations_->onCall = [&](Area area, const string&) {
    if (area != Area::Caches) return;
    inner = get("inner");
    EXPECT_EQ(factory_->managerForStoreIdentifier("unknown"), nullptr);
  };
  build();
  EXPECT_NE(get("outer"), nullptr);
  EXPECT_NE(inner, nullptr);
}

TEST_F(StoreManagerFactoryTest, TheMapperMayAskForAnotherManager) {
  define("outer", {}, true, Area::Caches);
  define("inner", {}, true, Area::Documents);
  std::atomic<int> depth{0};
  build(true, [&](const string&) {
    if (++depth == 1) {
      EXPECT_NE(get("inner"), nullptr);
    }
    return string("1");
  });
  EXPECT_NE(get("outer"), nullptr);
  EXPECT_EQ(depth, 2);
}

TEST_F(StoreManagerFactoryTest, WaitersOfABuildThatFailsGetTheBrokenPromise) {
  define("media");
  Latch building(1);
  Latch release(1);
  build(true, [&](const string&) -> string {
    building.countDown();
    release.wait();
    throw std::runtime_error("no tag");
  });
  std::thread creator([&] { EXPECT_THROW(get("media"), std::runtime_error); });
  building.wait();
  std::thread waiter([&] { EXPECT_TRUE(isBrokenPromise([&] { get("media"); })); });
  release.countDown();
  creator.join();
  waiter.join();
}

// Invalidation

TEST_F(StoreManagerFactoryTest, InvalidatingInvalidatesEveryManagerAndForgetsThem) {
  define("a", {{"s", fake("s")}}, true, Area::Caches);
  define("b", {}, true, Area::Documents);
  build();
  const auto a = get("a");
  const auto b = get("b");
  const auto store = a->getStore<FakeStore>("s");
  std::static_pointer_cast<session::Invalidatable>(factory_)->invalidate();
  EXPECT_FALSE(a->isValid());
  EXPECT_FALSE(b->isValid());
  EXPECT_EQ(store->invalidations(), 1U);
  Texts collected = trash->collected();
  std::sort(collected.begin(), collected.end());
  EXPECT_EQ(collected, (Texts{managerPath("_store_"), managerPath("_store_", Area::Documents)}));

  const auto fresh = get("a");
  EXPECT_NE(fresh, a);
  EXPECT_TRUE(fresh->isValid());
  EXPECT_NE(fresh->getStore<FakeStore>("s"), store);
}

TEST_F(StoreManagerFactoryTest, InvalidatingWithNothingBuiltDoesNothing) {
  define("media");
  build();
  factory_->invalidate();
  factory_->invalidate();
  EXPECT_TRUE(trash->collected().empty());
}

TEST_F(StoreManagerFactoryTest, InvalidatingTwiceLeavesTheFreshManagersAlone) {
  define("media");
  build();
  const auto first = get("media");
  factory_->invalidate();
  factory_->invalidate();
  EXPECT_EQ(trash->collected().size(), 1U);
  EXPECT_FALSE(first->isValid());
}

TEST_F(StoreManagerFactoryTest, InvalidatingSkipsRequestsThatGaveNoManagerAndLetsThemBeTriedAgain) {
  define("absent", {}, true, Area::Shared);
  define("wrong", {}, false);
  define("media", {}, true, Area::Caches);
  locations_->onCall = [](Area area, const string&) {
    if (area == Area::Shared) throw std::runtime_error("no card");
  };
  build();
  EXPECT_EQ(get("absent"), nullptr);
  EXPECT_EQ(get("wrong"), nullptr);
  const auto media = get("media");
  EXPECT_NO_THROW(factory_->invalidate());
  EXPECT_FALSE(media->isValid());
  locations_->onCall = nullptr;
  EXPECT_NE(get("absent"), nullptr);
}

TEST_F(StoreManagerFactoryTest, ABrokenPromiseStopsTheInvalidationAndTheMapIsEmptyAllTheSame) {
  define("media");
  build();
  EXPECT_THROW(get("x"), ConfigurationException);
  const auto media = get("media");
  EXPECT_TRUE(isBrokenPromise([&] { factory_->invalidate(); }));
  EXPECT_THROW(get("x"), ConfigurationException);  // asked anew, so the first caller again
  EXPECT_NE(get("media"), media);
}

TEST_F(StoreManagerFactoryTest, InvalidatingWaitsForAManagerThatIsBeingBuilt) {
  define("media");
  Latch building(1);
  Latch release(1);
  std::atomic<bool> released{false};
  locations_->onCall = [&](Area, const string&) {
    building.countDown();
    release.wait();
  };
  build();
  std::shared_ptr<StoreManager> manager;
  std::thread creator([&] { manager = get("media"); });
  building.wait();
  bool waited = false;
  std::thread invalidator([&] {
    factory_->invalidate();
    waited = released;
  });
  for (int i = 0; i < 1000; ++i) std::this_thread::yield();
  released = true;
  release.countDown();
  creator.join();
  invalidator.join();
  EXPECT_TRUE(waited);
  ASSERT_NE(manager, nullptr);
  EXPECT_FALSE(manager->isValid());
}

TEST_F(StoreManagerFactoryTest, ASecondInvalidationWaitsForTheFirst) {
  define("media", {{"s", fake("s")}});
  Latch invalidating(1);
  Latch release(1);
  Latch started(1);
  std::atomic<bool> returned{false};
  build();
  get("media")->getStore<FakeStore>("s")->onInvalidate = [&] {
    invalidating.countDown();
    release.wait();
  };
  std::thread first([&] { factory_->invalidate(); });
  invalidating.wait();
  std::thread second([&] {
    started.countDown();
    factory_->invalidate();
    returned = true;
  });
  started.wait();
  for (int i = 0; i < 10000 && !returned; ++i) std::this_thread::yield();
  EXPECT_FALSE(returned);
  release.countDown();
  first.join();
  second.join();
}

TEST_F(StoreManagerFactoryTest, AnInvalidationFromWithinAnotherReturns) {
  const test::Watchdog watchdog(60);
  define("media", {{"s", fake("s")}});
  build();
  bool returned = false;
  get("media")->getStore<FakeStore>("s")->onInvalidate = [&] {
    factory_->invalidate();
    returned = true;
  };
  factory_->invalidate();
  EXPECT_TRUE(returned);
}

TEST_F(StoreManagerFactoryTest, NoLockIsHeldWhileManagersAreInvalidated) {
  define("a", {{"s", fake("s")}}, true, Area::Caches);
  define("b", {}, true, Area::Documents);
  build();
  std::shared_ptr<StoreManager> b;
  get("a")->getStore<FakeStore>("s")->onInvalidate = [&] { std::thread([&] { b = get("b"); }).join(); };
  factory_->invalidate();
  ASSERT_NE(b, nullptr);
  EXPECT_TRUE(b->isValid());
}

TEST_F(StoreManagerFactoryTest, RequestsBesideAnInvalidationGetAManagerOfOneSideOrTheOther) {
  define("media");
  std::atomic<int> builds{0};
  for (int round = 0; round < 30; ++round) {
    // Each manager gets a directory of its own, so that discarding the one does not disturb the other.
    build(true, [&](const string&) { return std::to_string(++builds); });
    std::vector<std::shared_ptr<StoreManager>> managers(4);
    test::runOnThreads(managers.size() + 1, [&](std::size_t thread) {
      if (thread == managers.size()) return factory_->invalidate();
      managers[thread] = get("media");
    });
    for (const auto& manager : managers) ASSERT_NE(manager, nullptr);
    factory_->invalidate();
    for (const auto& manager : managers) ASSERT_FALSE(manager->isValid());
  }
}

TEST_F(StoreManagerFactoryTest, DestroyingTheFactoryInvalidatesNothing) {
  define("media");
  build();
  const auto manager = get("media");
  factory_.reset();
  EXPECT_TRUE(manager->isValid());
  EXPECT_TRUE(trash->collected().empty());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
