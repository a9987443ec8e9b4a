#include "host/Host.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <future>
#include <limits>
#include <memory>
#include <mutex>
#include <optional>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Configuration.h"
#include "DiskCache.h"
#include "DiskSizeCalculator.h"
#include "Future.h"
#include "JsonValue.h"
#include "LarderException.h"
#include "LazyDispatcher.h"
#include "PersistentKeyValueStore.h"
#include "PruneStrategy.h"
#include "Store.h"
#include "StoreManager.h"
#include "TrashCollector.h"
#include "host/Await.h"
#include "host/JsonLinesAnalytics.h"
#include "host/ThreadQueueFactory.h"
#include "host/testing/FaultyFileUtils.h"
#include "host/testing/ManualQueue.h"
#include "host/testing/RecordingAnalytics.h"
#include "support/Barrier.h"
#include "support/LogCapture.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using test::EventLog;
using test::FaultyFileUtils;
using test::Latch;
using test::LogCapture;
using test::ManualQueueFactory;
using test::runOnThreads;
using test::TemporaryDirectory;
using test::Watchdog;

constexpr std::chrono::hours kLongPatience(1);
constexpr unsigned int kLongEnough = 60;  // seconds, for whatever does not hang
constexpr long kHourInSeconds = 3600;

const char* const kConfiguration = R"({
  "media": {
    "session_scoped": false,
    "stores": {
      "thumbs": {"type": "unmanaged"},
      "pages": {"type": "unmanaged", "locale_sensitive": true, "has_version": true, "version": 3}
    }
  },
  "inbox": {"stores": {"letters": {"type": "unmanaged", "has_version": true}}},
  "archive": {"area": "documents", "stores": {"files": {"type": "unmanaged", "has_version": true}}}
})";

const char* const kConfigurationOfValues = R"({
  "media": {"stores": {
    "covers": {"type": "disk_cache", "lru_size_limit": "1MB", "prune_strategy": "lru"},
    "letters": {"type": "pkvs"}
  }}
})";

// A store type that no configuration has.
// As on a file system that leaves the types of a directory's entries open: they are left out of the list.
class FilesOfUnknownTypes : public FileUtils {
 public:
  std::vector<Info> listDirectory(const std::string& /*path*/) override { return {}; }
};

class CallingSink : public XAnalytics {
 public:
  explicit CallingSink(std::function<void()> call) : call_(std::move(call)) {}
  void logEvent(const std::string& /*name*/, const std::string& /*category*/, const std::string& /*payload*/,
                const std::string& /*time*/) override {
    call_();
  }

 private:
  const std::function<void()> call_;
};

class HostTest : public testing::Test {
 protected:
  // Lazy work waits longer than any test unless a test releases it.
  HostOptions options() const {
    HostOptions options;
    options.configuration = kConfiguration;
    options.root = directory.path();
    options.versionTag = "250";
    options.localeFirstTag = "en";
    options.localeSecondTag = "US";
    options.lazyDelaySeconds = kHourInSeconds;
    return options;
  }

  std::unique_ptr<Host> start() const { return std::make_unique<Host>(options()); }

  // What the error of asking for it says.
  template <class Error, class Request> static std::string errorOf(const Request& request) {
    try {
      request();
    } catch (const Error& error) {
      return error.what();
    }
    return "no error";
  }

  HostOptions optionsWith(std::shared_ptr<FileUtils> files, std::shared_ptr<TaskQueueFactory> queues = nullptr) const {
    HostOptions faulty = options();
    faulty.fileUtils = std::move(files);
    faulty.taskQueueFactory = std::move(queues);
    return faulty;
  }

  // The code of the file error that asking for it ends in; -1 for none.
  template <class Request> static int codeOf(const Request& request) {
    try {
      request();
    } catch (const FileUtilsIoException& error) {
      return error.code();
    }
    return -1;
  }

  std::string descriptionOfStarting(const std::string& configuration) const {
    try {
      const Host host(configuration, directory.path());
    } catch (const LarderException& error) {
      return error.description();
    }
    return "no error";
  }

  // What an earlier run has left of a session in two areas.
  void leaveSession(const std::string& key) const {
    HostOptions earlier = options();
    earlier.runMaintenance = false;  // others may be there
    Host host(std::move(earlier));
    for (const std::string store : {"letters", "files"}) {
      std::ofstream(host.store<UnmanagedStore>(store, key)->path + "/value") << key;
    }
  }

  static std::vector<std::string> tagsOf(const std::vector<StoredSession>& sessions) {
    std::vector<std::string> tags;
    for (const StoredSession& session : sessions) tags.push_back(session.tag);
    return tags;
  }

  const TemporaryDirectory directory;
  const std::string pathOfThumbs = directory.file("caches/_sessionlessStore/thumbs_250_v1");
};

// Getting started

TEST_F(HostTest, AConfigurationAndARootAreEnough) {
  Host host(kConfiguration, directory.path());
  const auto thumbs = host.store<UnmanagedStore>("thumbs");
  EXPECT_EQ(thumbs->path, directory.file("caches/_sessionlessStore/thumbs__v1"));
  EXPECT_TRUE(directory.exists("caches/_sessionlessStore/thumbs__v1"));
}

TEST_F(HostTest, TagsArePartOfTheNamesOfStores) {
  const auto host = start();
  EXPECT_EQ(host->store<UnmanagedStore>("thumbs")->path, directory.file("caches/_sessionlessStore/thumbs_250_v1"));
  EXPECT_EQ(host->store<UnmanagedStore>("pages")->path, directory.file("caches/_sessionlessStore/pages_en_US_v3"));
}

TEST_F(HostTest, StartingCreatesTheRootWithItsLockAndNothingElse) {
  HostOptions fresh = options();
  fresh.root = directory.file("data/storage");
  const Host host(std::move(fresh));
  EXPECT_EQ(directory.names("data/storage"), std::vector<std::string>{"_cellar_lock"});
}

TEST_F(HostTest, StartingWithoutTheLockTouchesNoDisk) {
  HostOptions unlocked = options();
  unlocked.lockRoot = false;
  const Host host(std::move(unlocked));
  EXPECT_TRUE(directory.names().empty());
}

TEST_F(HostTest, ARootThatCannotBeCreatedThrows) {
  directory.write("file", "not a directory");
  HostOptions impossible = options();
  impossible.root = directory.file("file/storage");
  EXPECT_EQ(codeOf([&] { Host host(std::move(impossible)); }), 0);
}

// One host at a time

TEST_F(HostTest, ASecondHostOnTheSameRootIsRefusedAndToldTheRootAndTheProcess) {
  const auto host = start();
  const std::string refusal = errorOf<FileUtilsIoException>([&] { start(); });
  EXPECT_NE(refusal.find("Root '" + directory.path() + "' is in use by process " + std::to_string(::getpid()) + "."),
            std::string::npos)
      << refusal;
  EXPECT_TRUE(host->manager("media")->isValid());
}

TEST_F(HostTest, AHostThatIsGoneLeavesItsRootToTheNext) {
  auto host = start();
  const auto held = host->store<UnmanagedStore>("thumbs");
  host.reset();
  host = start();
  EXPECT_TRUE(host->manager("media")->isValid());
}

TEST_F(HostTest, AHostWhoseConfigurationIsRefusedLeavesItsRootToTheNext) {
  EXPECT_THROW(Host("{", directory.path()), JsonValue::parse_error);
  EXPECT_THROW(Host(R"({"a": {}, "b": {}})", directory.path()), ConfigurationException);
  EXPECT_TRUE(start()->manager("media")->isValid());
}

TEST_F(HostTest, HostsWithoutTheLockMayShareARoot) {
  HostOptions unlocked = options();
  unlocked.lockRoot = false;
  const Host other(std::move(unlocked));
  const auto host = start();
  EXPECT_TRUE(host->manager("media")->isValid());
}

TEST_F(HostTest, OfManyHostsThatAreOpenedAtOnceOneGetsTheRootAndTheOthersLearnWhose) {
  const std::string owner = "is in use by process " + std::to_string(::getpid()) + ".";
  std::vector<std::unique_ptr<Host>> hosts(8);
  std::atomic<int> refused{0};
  runOnThreads(hosts.size(), [&](std::size_t i) {
    const std::string refusal = errorOf<FileUtilsIoException>([&] { hosts[i] = start(); });
    if (refusal.find(owner) != std::string::npos) ++refused;
  });
  EXPECT_EQ(refused, 7);
}

TEST_F(HostTest, EveryRequestGetsTheSameManagerAndTheSameStore) {
  const auto host = start();
  EXPECT_EQ(host->manager("media"), host->manager("media"));
  EXPECT_EQ(host->manager("media"), host->managerOfStore("thumbs"));
  EXPECT_EQ(host->store<UnmanagedStore>("thumbs"), host->store<UnmanagedStore>("thumbs"));
  EXPECT_EQ(host->store<Store>("thumbs"), host->manager("media")->getStore<UnmanagedStore>("thumbs"));
}

TEST_F(HostTest, ManyThreadsThatAskAtOnceGetTheSameManager) {
  const auto host = start();
  std::vector<std::shared_ptr<StoreManager>> managers(8);
  runOnThreads(8, [&](std::size_t i) { managers[i] = host->manager(i % 2 == 0 ? "media" : "inbox"); });
  for (std::size_t i = 2; i < managers.size(); ++i) EXPECT_EQ(managers[i], managers[i - 2]);
  EXPECT_NE(managers[0], managers[1]);
}

TEST_F(HostTest, ServicesAreThereForWhoeverBuildsMoreOnThem) {
  const auto host = start();
  EXPECT_EQ(host->configuration()->getManager("archive")->area, Area::Documents);
  EXPECT_NE(host->files(), nullptr);
  EXPECT_NE(host->attributes(), nullptr);
  EXPECT_NE(host->sizes(), nullptr);
  EXPECT_NE(host->lazyWork(), nullptr);
  EXPECT_EQ(host->analytics(), nullptr);
  await(dispatchTask<void>(host->queues()->createQueue(), [] {}));
  directory.write("trash/old", "bytes");
  host->trash()->emptyAllTrash();
  EXPECT_FALSE(directory.exists("trash"));
}

// Errors

TEST_F(HostTest, AnUnknownManagerThrowsEachTime) {
  const auto host = start();
  for (int i = 0; i < 2; ++i) {
    EXPECT_NE(errorOf<ConfigurationException>([&] { host->manager("music"); }).find("Manager 'music' not found."),
              std::string::npos);
  }
}

// The manager creates it in the background, and asks for the order of least recent use.
TEST_F(HostTest, ACacheThatIsCreatedBeforeAnybodyAsksForItIsGreedyDualIfItsDefinitionSaysSo) {
  HostOptions options = this->options();
  options.configuration = R"({"media": {"stores": {
    "covers": {"type": "disk_cache", "lru_size_limit": "1MB", "prune_strategy": "greedy_dual"},
    "films": {"type": "disk_cache", "lru_size_limit": "1MB", "prune_strategy": "video_download"}}}})";
  const auto queues = std::make_shared<ManualQueueFactory>();
  options.taskQueueFactory = queues;
  Host host(std::move(options));
  host.manager("media", "alice");
  host.lazyWork()->dispatchNow();
  queues->runAll();
  EXPECT_TRUE(host.metrics().managers.at(0).stores.at(0).isCreated);
  const auto strategyOf = [&](const char* store) { return host.store<DiskCache>(store)->getPruneStrategy(); };
  EXPECT_NE(std::dynamic_pointer_cast<GreedyDualPruneStrategy>(strategyOf("covers")), nullptr);
  EXPECT_NE(std::dynamic_pointer_cast<LRUPruneStrategy>(strategyOf("films")), nullptr);
}

TEST_F(HostTest, AnUnknownStoreThrowsEachTime) {
  const auto host = start();
  for (int i = 0; i < 2; ++i) {
    EXPECT_NE(errorOf<ConfigurationException>([&] { host->store<Store>("songs"); }).find("Store 'songs' not found."),
              std::string::npos);
  }
}

TEST_F(HostTest, AStoreOfAnotherTypeThrows) {
  const auto host = start();
  EXPECT_EQ(errorOf<std::logic_error>([&] { host->store<PersistentKeyValueStore>("thumbs"); }),
            "Store 'thumbs' is a velmora::mobile::xplat::cellar::UnmanagedStore, not a "
            "velmora::mobile::xplat::cellar::PersistentKeyValueStore. Ask for the class that belongs to its \"type\".");
}

TEST_F(HostTest, ErrorsOfTheConfigurationPassThroughWithTheirPlace) {
  EXPECT_THROW(Host("{", "/nowhere"), JsonValue::parse_error);
  EXPECT_EQ(errorOf<std::invalid_argument>([] { Host(R"({"media": {"area": "attic"}})", "/nowhere"); }),
            "Configuration, /media/area, line 1, column 20: Invalid area 'attic', use caches, documents or shared.");
  EXPECT_EQ(descriptionOfStarting(R"({"a": {"stores": {"s": {"type": "unmanaged"}, "s": {"type": "unmanaged"}}}})"),
            "Duplicate store definition.");
}

TEST_F(HostTest, AnEmptyRootThrows) {
  EXPECT_EQ(errorOf<std::invalid_argument>([] { Host("{}", ""); }), "A host needs a root directory.");
}

TEST_F(HostTest, ManagersThatWouldShareADirectoryAreRefused) {
  EXPECT_EQ(descriptionOfStarting(R"({"a": {}, "b": {"area": "caches"}})"),
            "Managers 'a' and 'b' would share a directory, give them different areas or session scopes.");
  EXPECT_EQ(descriptionOfStarting(R"({"a": {}, "b": {"session_scoped": false}, "c": {"area": "shared"}})"), "no error");
}

// Creation that fails

TEST_F(HostTest, AStoreThatCouldNotBeCreatedIsCreatedByTheNextRequest) {
  const Watchdog watchdog(kLongEnough);
  const auto files = std::make_shared<FaultyFileUtils>();
  Host host(optionsWith(files));
  files->failPath(FaultyFileUtils::Operation::CreateDirectory, pathOfThumbs, ENOSPC);
  for (int i = 0; i < 2; ++i) EXPECT_EQ(codeOf([&] { host.store<Store>("thumbs"); }), ENOSPC);
  files->heal();
  const auto thumbs = host.store<UnmanagedStore>("thumbs");
  EXPECT_TRUE(directory.exists("caches/_sessionlessStore/thumbs_250_v1"));
  EXPECT_EQ(host.manager("media")->getStore<UnmanagedStore>("thumbs"), thumbs);
}

TEST_F(HostTest, AStoreWithAFileInItsPlaceIsCreatedOnceTheFileIsGone) {
  const Watchdog watchdog(kLongEnough);
  const auto host = start();
  const std::string file = directory.write("caches/_sessionlessStore/thumbs_250_v1", "not a directory");
  for (int i = 0; i < 2; ++i) EXPECT_EQ(codeOf([&] { host->store<Store>("thumbs"); }), 0);
  std::filesystem::remove(file);
  EXPECT_EQ(host->store<UnmanagedStore>("thumbs")->path, file);
}

TEST_F(HostTest, AStoreWhoseCreationInTheBackgroundFailedUnnoticedIsCreatedOnRequest) {
  const Watchdog watchdog(kLongEnough);
  const LogCapture log;
  const auto queues = std::make_shared<ManualQueueFactory>();
  const auto files = std::make_shared<FaultyFileUtils>();
  Host host(optionsWith(files, queues));
  host.manager("media");
  files->failPath(FaultyFileUtils::Operation::CreateDirectory, pathOfThumbs, EIO);
  host.lazyWork()->dispatchNow();
  queues->runAll();
  EXPECT_TRUE(log.contains("Could not initialize store thumbs: "));
  EXPECT_EQ(codeOf([&] { host.store<Store>("thumbs"); }), EIO);
  files->heal();
  EXPECT_NE(host.store<UnmanagedStore>("thumbs"), nullptr);
  queues->runAll();  // what reports its size keeps the manager
}

TEST_F(HostTest, TheBackgroundDoesNotWaitForAStoreThatFailedOnRequest) {
  const Watchdog watchdog(kLongEnough);
  const auto queues = std::make_shared<ManualQueueFactory>();
  const auto files = std::make_shared<FaultyFileUtils>();
  Host host(optionsWith(files, queues));
  files->failPath(FaultyFileUtils::Operation::CreateDirectory, pathOfThumbs, EIO);
  EXPECT_EQ(codeOf([&] { host.store<Store>("thumbs"); }), EIO);
  files->heal();
  host.lazyWork()->dispatchNow();
  queues->runAll();
  EXPECT_TRUE(directory.exists("caches/_sessionlessStore/thumbs_250_v1"));
  EXPECT_TRUE(directory.exists("caches/_sessionlessStore/pages_en_US_v3"));
}

TEST_F(HostTest, OfManyThatAskForAStoreThatCannotBeCreatedEachGetsTheError) {
  const Watchdog watchdog(kLongEnough);
  const auto files = std::make_shared<FaultyFileUtils>();
  Host host(optionsWith(files));
  host.manager("media");
  files->failPath(FaultyFileUtils::Operation::CreateDirectory, pathOfThumbs, EIO);
  std::atomic<int> failed{0};
  runOnThreads(8, [&] {
    if (codeOf([&] { host.store<Store>("thumbs"); }) == EIO) ++failed;
  });
  EXPECT_EQ(failed, 8);
}

TEST_F(HostTest, OfManyThatAskForAStoreOneMeetsThePassingErrorAndTheOthersGetTheStore) {
  const Watchdog watchdog(kLongEnough);
  const auto files = std::make_shared<FaultyFileUtils>();
  Host host(optionsWith(files));
  host.manager("media");
  files->failNext(FaultyFileUtils::Operation::CreateDirectory, EIO);
  std::vector<std::shared_ptr<Store>> stores(8);
  runOnThreads(8, [&](std::size_t i) {
    try {
      stores[i] = host.store<Store>("thumbs");
    } catch (const FileUtilsIoException&) {
    }
  });
  const auto thumbs = host.store<Store>("thumbs");
  EXPECT_EQ(std::count(stores.begin(), stores.end(), thumbs), 7);
}

TEST_F(HostTest, AManagerThatCouldNotBeBuiltIsBuiltByTheNextRequestAndNothingIsDiscarded) {
  start()->store<UnmanagedStore>("letters", "alice");
  directory.write("caches/_store_alice/letters_v1/letter", "kept");
  const auto files = std::make_shared<FaultyFileUtils>();
  Host host(optionsWith(files));
  files->failAlways(FaultyFileUtils::Operation::CreateDirectory, ENOSPC);
  for (int i = 0; i < 2; ++i) EXPECT_EQ(codeOf([&] { host.manager("inbox", "alice"); }), ENOSPC);
  files->heal();
  const auto inbox = host.manager("inbox", "alice");
  EXPECT_TRUE(inbox->isValid());
  EXPECT_EQ(host.manager("inbox"), inbox);
  EXPECT_EQ(directory.read("caches/_store_alice/letters_v1/letter"), "kept");
}

TEST_F(HostTest, OfManyThatAskForAManagerThatCannotBeBuiltEachGetsTheError) {
  const auto files = std::make_shared<FaultyFileUtils>();
  Host host(optionsWith(files));
  files->failAlways(FaultyFileUtils::Operation::CreateDirectory, ENOSPC);
  std::atomic<int> failed{0};
  runOnThreads(8, [&] {
    if (codeOf([&] { host.manager("media"); }) == ENOSPC) ++failed;
  });
  EXPECT_EQ(failed, 8);
}

TEST_F(HostTest, AKeyThatCannotNameADirectoryOpensNoSession) {
  const auto host = start();
  EXPECT_EQ(errorOf<std::length_error>([&] { host->manager("inbox", std::string(300, 'x')); }),
            "A session's key of 300 bytes would be too long for a file name. Set a session tag mapper.");  // no secrets
  EXPECT_TRUE(host->manager("inbox", "alice")->isValid());
}

TEST_F(HostTest, AfterARequestForAnUnknownNameLogOutAndInvalidateComplete) {
  const Watchdog watchdog(kLongEnough);
  const auto host = start();
  const auto inbox = host->manager("inbox", "alice");
  const auto media = host->manager("media");
  EXPECT_THROW(host->manager("music"), ConfigurationException);
  EXPECT_THROW(host->store<Store>("songs"), ConfigurationException);
  host->logOut();
  EXPECT_FALSE(inbox->isValid());
  host->invalidate();
  EXPECT_FALSE(media->isValid());
}

TEST_F(HostTest, AStoreIsNeverEmptyNotEvenThatOfAManagerThatSomebodyHasInvalidated) {
  const auto host = start();
  host->manager("media")->invalidate();
  EXPECT_EQ(errorOf<InvalidatedException>([&] { host->store<Store>("thumbs"); }),
            InvalidatedException("The manager of store 'thumbs' has been invalidated.").what());
  host->invalidate();
  EXPECT_NE(host->store<Store>("thumbs"), nullptr);
}

TEST_F(HostTest, AMapperIsAskedForTheNameOfTheSessionThatOpensAndForNoOther) {
  HostOptions mapped = options();
  mapped.sessionTagMapper = [](const std::string& key) {
    if (key.empty()) throw std::invalid_argument("no key");
    return "of-" + key;
  };
  Host host(std::move(mapped));
  EXPECT_THROW(host.manager("inbox"), std::invalid_argument);
  host.manager("inbox", "alice");
  EXPECT_EQ(host.store<UnmanagedStore>("files")->path, directory.file("documents/_store_of-alice/files_v1"));
}

// Sessions

TEST_F(HostTest, ASessionHasDirectoriesOfItsOwn) {
  const auto host = start();
  host->manager("inbox", "alice");
  EXPECT_EQ(host->store<UnmanagedStore>("letters")->path, directory.file("caches/_store_alice/letters_v1"));
}

TEST_F(HostTest, AStoreMayOpenTheSession) {
  const auto host = start();
  EXPECT_EQ(host->store<UnmanagedStore>("letters", "alice")->path, directory.file("caches/_store_alice/letters_v1"));
}

TEST_F(HostTest, SessionKeysBecomeNamesThatAreSafeInAPath) {
  const auto host = start();
  host->manager("inbox", "../Al_\xFF-9");
  EXPECT_EQ(directory.names("caches"), std::vector<std::string>{"_store_%2e.%2f%41l%5f%ff-9"});
}

TEST_F(HostTest, AMapperOfTheApplicationNamesSessions) {
  HostOptions mapped = options();
  mapped.sessionTagMapper = [](const std::string& key) { return "of-" + key; };
  Host host(std::move(mapped));
  host.manager("inbox", "Alice");
  EXPECT_EQ(directory.names("caches"), std::vector<std::string>{"_store_of-Alice"});
}

TEST_F(HostTest, RequestsWithoutAKeyMeanTheOpenSession) {
  const auto host = start();
  const auto inbox = host->manager("inbox", "alice");
  EXPECT_EQ(host->manager("inbox"), inbox);
  EXPECT_EQ(host->store<UnmanagedStore>("files")->path, directory.file("documents/_store_alice/files_v1"));
}

TEST_F(HostTest, ARequestWithoutAKeyOpensTheEmptySession) {
  const auto host = start();
  EXPECT_EQ(host->store<UnmanagedStore>("letters")->path, directory.file("caches/_store_/letters_v1"));
  EXPECT_EQ(host->manager("inbox"), host->manager("inbox", ""));
  EXPECT_THROW(host->manager("inbox", "alice"), std::logic_error);
}

TEST_F(HostTest, AnotherSessionIsRefusedUntilTheFirstLogsOut) {
  const auto host = start();
  const auto inbox = host->manager("inbox", "alice");
  const std::string refusal = "Another session is open, log out before you ask for a new one.";
  EXPECT_EQ(errorOf<std::logic_error>([&] { host->manager("inbox", "bob"); }), refusal);
  EXPECT_EQ(errorOf<std::logic_error>([&] { host->store<Store>("files", "bob"); }), refusal);
  EXPECT_EQ(host->manager("inbox", "alice"), inbox);
  EXPECT_FALSE(directory.exists("documents"));
}

TEST_F(HostTest, ManagersWithoutSessionScopeIgnoreKeysAndOpenNoSession) {
  const auto host = start();
  EXPECT_EQ(host->manager("media", "alice"), host->manager("media", "bob"));
  EXPECT_NO_THROW(host->manager("inbox", "carol"));
  EXPECT_EQ(host->manager("media", "dave"), host->manager("media"));
}

TEST_F(HostTest, OfManySessionsThatAreAskedForAtOnceOneOpens) {
  const auto host = start();
  std::atomic<int> opened{0};
  std::atomic<int> refused{0};
  runOnThreads(4, [&](std::size_t i) {
    try {
      host->manager("inbox", "user-" + std::to_string(i));
      ++opened;
    } catch (const std::logic_error&) {
      ++refused;
    }
  });
  EXPECT_EQ(opened, 1);
  EXPECT_EQ(refused, 3);
  EXPECT_EQ(directory.names("caches").size(), 1U);
}

// Logging out

TEST_F(HostTest, LoggingOutDiscardsTheSessionAndLeavesTheRest) {
  const auto host = start();
  const auto inbox = host->manager("inbox", "alice");
  const auto media = host->manager("media");
  directory.write("caches/_store_alice/letters_v1/letter", "secret");
  host->logOut();
  EXPECT_FALSE(inbox->isValid());
  EXPECT_TRUE(media->isValid());
  EXPECT_EQ(directory.names("caches"), std::vector<std::string>{"_sessionlessStore"});
}

TEST_F(HostTest, AfterLoggingOutAnotherSessionMayOpen) {
  const auto host = start();
  const auto ofAlice = host->store<UnmanagedStore>("letters", "alice");
  host->logOut();
  const auto ofBob = host->store<UnmanagedStore>("letters", "bob");
  EXPECT_NE(ofBob, ofAlice);
  EXPECT_EQ(ofBob->path, directory.file("caches/_store_bob/letters_v1"));
  EXPECT_TRUE(host->manager("inbox")->isValid());
}

TEST_F(HostTest, ASessionThatOpensAgainBeginsEmpty) {
  const auto host = start();
  host->store<UnmanagedStore>("letters", "alice");
  directory.write("caches/_store_alice/letters_v1/letter", "secret");
  host->logOut();
  host->store<UnmanagedStore>("letters", "alice");
  EXPECT_TRUE(directory.names("caches/_store_alice/letters_v1").empty());
}

TEST_F(HostTest, LoggingOutDiscardsWhatEarlierRunsLeftToManagersThatNobodyAskedFor) {
  start()->store<UnmanagedStore>("files", "alice");
  directory.write("documents/_store_alice/files_v1/file", "secret");
  const auto host = start();
  host->manager("inbox", "alice");
  host->logOut();
  EXPECT_TRUE(directory.names("documents").empty());
}

TEST_F(HostTest, LoggingOutLeavesOtherSessionsToMaintenance) {
  HostOptions withoutMaintenance = options();
  withoutMaintenance.runMaintenance = false;
  Host host(std::move(withoutMaintenance));
  directory.makeDirectory("caches/_store_bob");
  host.manager("inbox", "alice");
  host.logOut();
  EXPECT_EQ(directory.names("caches"), std::vector<std::string>{"_store_bob"});
}

TEST_F(HostTest, MaintenanceRemovesOtherSessions) {
  directory.makeDirectory("caches/_store_bob");
  start()->manager("inbox", "alice");  // destroyed at once, with everything that was queued done
  EXPECT_EQ(directory.names("caches"), std::vector<std::string>{"_store_alice"});
}

TEST_F(HostTest, LoggingOutBeforeASessionIsOpenedSaysThatThereIsOneToName) {
  start()->store<UnmanagedStore>("letters", "alice");
  const auto host = start();
  EXPECT_EQ(
      errorOf<std::logic_error>([&] { host->logOut(); }),
      "No session has been opened yet. Sessions with data on disk: 1. Name the one to end, as in logOut(sessionKey).");
  EXPECT_TRUE(directory.exists("caches/_store_alice"));
}

TEST_F(HostTest, LoggingOutWithoutASessionAndItsDataDoesNothing) {
  const auto host = start();
  host->manager("media");
  host->logOut();
  EXPECT_TRUE(host->manager("media")->isValid());
}

TEST_F(HostTest, LoggingOutTwiceIsLoggingOutOnce) {
  const auto host = start();
  host->manager("inbox", "alice");
  host->logOut();
  host->logOut();
  EXPECT_TRUE(host->manager("inbox", "bob")->isValid());
}

TEST_F(HostTest, AManagerThatCouldNotBeBuiltKeepsNoOtherFromBeingLoggedOut) {
  for (const std::string broken : {"caches", "documents"}) {
    auto files = std::make_shared<FaultyFileUtils>();
    HostOptions faulty = options();
    faulty.fileUtils = files;
    Host host(std::move(faulty));
    files->failPath(FaultyFileUtils::Operation::CreateDirectory, directory.file(broken + "/_store_alice/tmp"), ENOSPC);
    std::vector<std::shared_ptr<StoreManager>> built;
    for (const std::string name : {"inbox", "archive"}) {
      try {
        built.push_back(host.manager(name, "alice"));
      } catch (const FileUtilsIoException&) {
      }
    }
    ASSERT_EQ(built.size(), 1U);
    host.logOut();
    EXPECT_FALSE(built.front()->isValid());
    EXPECT_FALSE(directory.exists("caches/_store_alice"));
    EXPECT_FALSE(directory.exists("documents/_store_alice"));
  }
}

TEST_F(HostTest, NoManagerOfASessionSurvivesItsLogOut) {
  const auto host = start();
  std::mutex mutex;
  std::vector<std::shared_ptr<StoreManager>> managers;
  std::atomic<std::size_t> refused{0};
  runOnThreads(4, [&](std::size_t thread) {
    for (int i = 0; i < 20; ++i) {
      if (thread == 0) {
        host->logOut();
        continue;
      }
      try {
        auto manager = host->manager(thread == 1 ? "archive" : "inbox");
        const std::lock_guard<std::mutex> lock(mutex);
        managers.push_back(std::move(manager));
      } catch (const InvalidatedException&) {
        ++refused;  // asked for while the session was ending
      }
    }
  });
  host->logOut();
  EXPECT_EQ(managers.size() + refused, 60U);
  for (const auto& manager : managers) EXPECT_FALSE(manager->isValid());
}

// Sessions of earlier runs

TEST_F(HostTest, ASessionIsLoggedOutAfterARestartInAllAreasThoughNobodyHasOpenedIt) {
  leaveSession("alice");
  const auto host = start();
  EXPECT_TRUE(host->logOut("alice"));
  EXPECT_TRUE(directory.names("caches").empty());
  EXPECT_TRUE(directory.names("documents").empty());
  EXPECT_TRUE(directory.names(host->store<UnmanagedStore>("letters", "alice")->path.substr(directory.path().size() + 1))
                  .empty());
}

TEST_F(HostTest, LoggingOutTheSessionThatIsOpenByItsKeyEndsIt) {
  const auto host = start();
  const auto inbox = host->manager("inbox", "alice");
  EXPECT_TRUE(host->logOut("alice"));
  EXPECT_FALSE(inbox->isValid());
  EXPECT_TRUE(directory.names("caches").empty());
  EXPECT_TRUE(host->manager("inbox", "bob")->isValid());
}

TEST_F(HostTest, LoggingOutASessionLeavesTheOthersAndTheOpenOneAlone) {
  leaveSession("bob");
  leaveSession("carol");
  HostOptions withoutMaintenance = options();
  withoutMaintenance.runMaintenance = false;
  Host host(std::move(withoutMaintenance));
  const auto inbox = host.manager("inbox", "alice");
  EXPECT_TRUE(host.logOut("bob"));
  EXPECT_EQ(tagsOf(host.sessions()), (std::vector<std::string>{"alice", "carol"}));
  EXPECT_TRUE(inbox->isValid());
  EXPECT_EQ(host.manager("inbox"), inbox);
}

TEST_F(HostTest, LoggingOutASessionWithoutDataIsNotAnError) {
  const auto host = start();
  EXPECT_FALSE(host->logOut("alice"));
  host->manager("inbox", "bob");
  EXPECT_FALSE(host->logOut("alice"));
}

TEST_F(HostTest, LoggingOutAKeyThatCannotNameADirectoryThrows) {
  EXPECT_THROW(start()->logOut(std::string(300, 'x')), std::length_error);
}

TEST_F(HostTest, SessionsWithDataOnDiskAreListedWithTheirKeys) {
  leaveSession("Al/ice");
  leaveSession("");
  directory.makeDirectory("shared/_store_carol");
  directory.makeDirectory("shared/_store_Dave");  // of another mapper
  directory.makeDirectory("shared/_store_%");
  directory.makeDirectory("shared/_sessionlessStore");
  directory.makeDirectory("shared/_cellar_quarantine");
  directory.write("shared/_store_file", "no directory");
  const auto host = start();
  std::vector<std::pair<std::string, std::optional<std::string>>> found;
  for (const StoredSession& session : host->sessions()) found.emplace_back(session.tag, session.key);
  EXPECT_EQ(found,
            (std::vector<std::pair<std::string, std::optional<std::string>>>{
                {"", ""}, {"%", std::nullopt}, {"%41l%2fice", "Al/ice"}, {"Dave", std::nullopt}, {"carol", "carol"}}));
}

TEST_F(HostTest, EverySessionThatIsListedCanBeLoggedOut) {
  leaveSession("alice");
  leaveSession("bob");
  directory.makeDirectory("shared/_store_Of another mapper");
  const auto host = start();
  for (const StoredSession& session : host->sessions()) EXPECT_TRUE(host->logOut(session));
  EXPECT_TRUE(host->sessions().empty());
}

TEST_F(HostTest, ThereAreNoSessionsBeforeThereIsAnArea) { EXPECT_TRUE(start()->sessions().empty()); }

TEST_F(HostTest, SessionsThatAMapperOfTheApplicationHasNamedAreListedWithoutKeys) {
  HostOptions mapped = options();
  mapped.sessionTagMapper = [](const std::string& key) { return "of-" + key; };
  Host host(std::move(mapped));
  host.manager("inbox", "alice");
  const auto sessions = host.sessions();
  ASSERT_EQ(tagsOf(sessions), std::vector<std::string>{"of-alice"});
  EXPECT_FALSE(sessions.front().key);
  EXPECT_TRUE(host.logOut("alice"));
  EXPECT_TRUE(host.sessions().empty());
}

TEST_F(HostTest, LoggingOutAKeyThatNamesTheDirectoriesOfTheOpenSessionEndsThat) {
  HostOptions mapped = options();
  mapped.sessionTagMapper = [](const std::string& key) { return key.substr(0, 1); };
  Host host(std::move(mapped));
  const auto inbox = host.manager("inbox", "alice");
  EXPECT_TRUE(host.logOut("anna"));
  EXPECT_FALSE(inbox->isValid());
}

TEST_F(HostTest, ALinkInTheDirectorysPlaceIsASessionToo) {
  directory.write("elsewhere/letters_v1/letter", "kept");
  directory.makeDirectory("caches");
  std::filesystem::create_symlink(directory.file("elsewhere"), directory.file("caches/_store_alice"));
  const auto host = start();
  EXPECT_EQ(tagsOf(host->sessions()), std::vector<std::string>{"alice"});
  EXPECT_TRUE(host->logOut("alice"));
  EXPECT_TRUE(host->sessions().empty());
  EXPECT_EQ(directory.read("elsewhere/letters_v1/letter"), "kept");
}

TEST_F(HostTest, ASessionIsLoggedOutWhereListingsDoNotTellWhatIsADirectory) {
  leaveSession("alice");
  Host host(optionsWith(std::make_shared<FilesOfUnknownTypes>()));
  EXPECT_TRUE(host.logOut("alice"));
  EXPECT_TRUE(directory.names("caches").empty());
  EXPECT_TRUE(directory.names("documents").empty());
}

TEST_F(HostTest, WhatCannotBeDiscardedIsSaidAndTheRestIsDiscarded) {
  leaveSession("alice");
  const auto files = std::make_shared<FaultyFileUtils>();
  Host host(optionsWith(files));
  files->failPath(FaultyFileUtils::Operation::Rename, directory.file("caches/_store_alice"), EIO);
  EXPECT_NE(errorOf<FileUtilsIoException>([&] { host.logOut("alice"); })
                .find("Data of the session remains: could not move \"" + directory.file("caches/_store_alice") +
                      "\" to the trash"),
            std::string::npos);
  EXPECT_TRUE(directory.exists("caches/_store_alice/letters_v1/value"));
  EXPECT_TRUE(directory.names("documents").empty());
  files->heal();
  EXPECT_TRUE(host.logOut("alice"));
  EXPECT_TRUE(host.sessions().empty());
}

TEST_F(HostTest, AnOpenSessionWhoseDataCannotBeDiscardedHasEndedAllTheSame) {
  const auto files = std::make_shared<FaultyFileUtils>();
  Host host(optionsWith(files));
  const auto inbox = host.manager("inbox", "alice");
  files->failAlways(FaultyFileUtils::Operation::Rename, EIO);
  EXPECT_EQ(codeOf([&] { host.logOut(); }), 0);
  EXPECT_FALSE(inbox->isValid());
  EXPECT_TRUE(directory.exists("caches/_store_alice"));
  files->heal();
  EXPECT_TRUE(host.logOut("alice"));
  EXPECT_TRUE(host.manager("inbox", "bob")->isValid());
}

TEST_F(HostTest, AnAreaThatCannotBeReadIsNotTakenForEmpty) {
  leaveSession("alice");
  const auto files = std::make_shared<FaultyFileUtils>();
  Host host(optionsWith(files));
  files->failPath(FaultyFileUtils::Operation::ListDirectory, directory.file("caches"), EACCES);
  const std::string reason = "could not read \"" + directory.file("caches") + "\": ";
  EXPECT_NE(errorOf<FileUtilsIoException>([&] { host.sessions(); }).find(reason), std::string::npos);
  EXPECT_NE(errorOf<FileUtilsIoException>([&] { host.logOut("alice"); }).find("remains: " + reason), std::string::npos);
  EXPECT_TRUE(directory.names("documents").empty());
}

TEST_F(HostTest, ASessionCannotBeOpenedWhileItIsDiscardedAndOthersCan) {
  leaveSession("bob");
  const auto files = std::make_shared<FaultyFileUtils>();
  Host host(optionsWith(files));
  std::string refusal;
  bool isOther = false;
  files->onCall = [&](FaultyFileUtils::Operation operation, const std::string& path) {
    if (operation != FaultyFileUtils::Operation::Rename || path != directory.file("caches/_store_bob")) return;
    refusal = errorOf<InvalidatedException>([&] { host.manager("inbox", "bob"); });
    isOther = host.manager("archive", "alice")->isValid();
  };
  EXPECT_TRUE(host.logOut("bob"));
  EXPECT_EQ(refusal, InvalidatedException("The session is being logged out.").what());
  EXPECT_TRUE(isOther);
}

TEST_F(HostTest, LoggingOutByKeyBesideRequestsLeavesNoManagerOfTheSessionValid) {
  const LogCapture log;  // two that discard a directory at once meet each other
  const auto host = start();
  std::mutex mutex;
  std::vector<std::shared_ptr<StoreManager>> managers;
  runOnThreads(4, [&](std::size_t thread) {
    for (int i = 0; i < 20; ++i) {
      if (thread < 2) {
        host->logOut("alice");
        continue;
      }
      try {
        auto manager = host->manager(thread == 2 ? "archive" : "inbox", "alice");
        const std::lock_guard<std::mutex> lock(mutex);
        managers.push_back(std::move(manager));
      } catch (const InvalidatedException&) {
      }
    }
  });
  host->logOut("alice");
  for (const auto& manager : managers) EXPECT_FALSE(manager->isValid());
  EXPECT_TRUE(host->sessions().empty());
}

// Waiting would be for ever: the end of the session waits for the queue that the request is made on.
TEST_F(HostTest, ARequestOnAStoresQueueIsRefusedWhileTheSessionEnds) {
  Host host(kConfigurationOfValues, directory.path());
  const auto letters = host.store<PersistentKeyValueStore>("letters");
  Latch isWriting(1);
  Latch isEnding(1);
  std::string refusal;
  auto written = letters->store("key", nullptr, [&](const std::string&) {
    isWriting.countDown();
    isEnding.wait();
    refusal = errorOf<InvalidatedException>([&] { host.manager("media"); });
    return 0U;
  });
  isWriting.wait();
  std::thread ending([&] { host.logOut(); });
  const auto isRefused = [&] { return errorOf<InvalidatedException>([&] { host.manager("media"); }) != "no error"; };
  while (!isRefused()) std::this_thread::yield();
  isEnding.countDown();
  ending.join();
  await(std::move(written));
  EXPECT_EQ(refusal, InvalidatedException("The managers are being invalidated.").what());
  EXPECT_TRUE(host.manager("media")->isValid());
}

TEST_F(HostTest, ManagersWithoutSessionAreRefusedWhileTheyAreInvalidatedAndOnlyThen) {
  const auto host = start();
  std::atomic<bool> isOver{false};
  std::vector<std::shared_ptr<StoreManager>> managers;
  runOnThreads(2, [&](std::size_t thread) {
    if (thread == 0) {
      for (int i = 0; i < 20; ++i) host->invalidate();
      isOver = true;
      return;
    }
    while (!isOver) {
      try {
        managers.push_back(host->manager("media"));
      } catch (const InvalidatedException&) {
        continue;
      }
    }
  });
  const auto latest = host->manager("media");
  for (const auto& manager : managers) EXPECT_EQ(manager->isValid(), manager == latest);
}

TEST_F(HostTest, InvalidatingDiscardsEverythingThatWasAskedFor) {
  const auto host = start();
  const auto inbox = host->manager("inbox", "alice");
  const auto media = host->manager("media");
  host->invalidate();
  EXPECT_FALSE(inbox->isValid());
  EXPECT_FALSE(media->isValid());
  EXPECT_TRUE(directory.names("caches").empty());
  EXPECT_TRUE(host->manager("media")->isValid());
  EXPECT_NO_THROW(host->manager("inbox", "bob"));
}

TEST_F(HostTest, InvalidatingWithoutASessionDiscardsTheOtherManagers) {
  const auto host = start();
  const auto media = host->manager("media");
  session::Invalidatable& invalidatable = *host;
  invalidatable.invalidate();
  EXPECT_FALSE(media->isValid());
}

TEST_F(HostTest, ALateCleanupOfASessionLeavesTheNextSessionAlone) {
  const auto queues = std::make_shared<ManualQueueFactory>();
  HostOptions manual = options();
  manual.taskQueueFactory = queues;
  Host host(std::move(manual));
  host.manager("inbox", "alice");  // its cleanup is queued and not run yet
  host.logOut();
  host.store<UnmanagedStore>("letters", "bob");
  queues->runAll();
  EXPECT_TRUE(directory.exists("caches/_store_bob/letters_v1"));
}

// Stores of values

TEST_F(HostTest, ValuesAreKeptFromRunToRun) {
  const std::vector<unsigned char> picture = {0xff, 0xd8};
  {
    Host host(kConfigurationOfValues, directory.path());
    await(host.store<DiskCache>("covers", "alice")->store("sunrise", picture));
    host.store<PersistentKeyValueStore>("letters")->store("first", {1, 2, 3});  // the end of the host waits for it
  }
  Host host(kConfigurationOfValues, directory.path());
  const auto cover = await(host.store<DiskCache>("covers", "alice")->fetch("sunrise"));
  ASSERT_NE(cover, nullptr);
  EXPECT_EQ(cover->value, picture);
  const auto letter = await(host.store<PersistentKeyValueStore>("letters")->fetch("first"));
  ASSERT_NE(letter, nullptr);
  EXPECT_EQ(letter->value, (std::vector<unsigned char>{1, 2, 3}));
}

TEST_F(HostTest, AKeyThatIsNotThereIsANullResult) {
  Host host(kConfigurationOfValues, directory.path());
  EXPECT_EQ(await(host.store<DiskCache>("covers")->fetch("sunset")), nullptr);
}

TEST_F(HostTest, ValuesOfASessionAreGoneAfterLoggingOut) {
  Host host(kConfigurationOfValues, directory.path());
  const auto before = host.store<DiskCache>("covers", "alice");
  await(before->store("sunrise", {1}));
  host.logOut();
  EXPECT_THROW(static_cast<void>(await(before->fetch("sunrise"))), InvalidatedException);
  EXPECT_EQ(await(host.store<DiskCache>("covers", "alice")->fetch("sunrise")), nullptr);
}

TEST_F(HostTest, AStoreThatIsHeldAfterTheHostFailsItsFutures) {
  auto host = std::make_unique<Host>(kConfigurationOfValues, directory.path());
  const auto covers = host->store<DiskCache>("covers");
  host.reset();
  EXPECT_THROW(static_cast<void>(await(covers->store("sunrise", {1}))), std::future_error);
}

// Waiting would be for ever: what is awaited runs on the queue that waits.
TEST_F(HostTest, AwaitingInACallbackOfTheSameStoreIsRefused) {
  const Watchdog watchdog(kLongEnough);
  Host host(kConfigurationOfValues, directory.path());
  const auto letters = host.store<PersistentKeyValueStore>("letters");
  std::promise<std::string> refusal;
  letters->store("first", {1}).then(nullptr, [&](std::future<void>&) {
    refusal.set_value(errorOf<std::logic_error>([&] { (void)await(letters->fetch("first")); }));
  });
  EXPECT_EQ(refusal.get_future().get(),
            "await may deadlock on a thread of the host kit's queues. Use Future::then instead.");
  EXPECT_NE(await(letters->fetch("first")), nullptr);
}

TEST_F(HostTest, EndingASessionInACallbackOfItsStoreIsRefusedAndChangesNothing) {
  const Watchdog watchdog(kLongEnough);
  Host host(kConfigurationOfValues, directory.path());
  const auto letters = host.store<PersistentKeyValueStore>("letters");
  std::promise<std::vector<std::string>> refusals;
  letters->store("first", {1}).then(nullptr, [&](std::future<void>&) {
    refusals.set_value({errorOf<std::logic_error>([&] { host.logOut(); }),
                        errorOf<std::logic_error>([&] { host.logOut(""); }),
                        errorOf<std::logic_error>([&] { host.invalidate(); })});
  });
  const std::string rest = " may deadlock on a thread of the host kit's queues. Use a thread of your own instead.";
  EXPECT_EQ(refusals.get_future().get(),
            (std::vector<std::string>{"Host::logOut" + rest, "Host::logOut" + rest, "Host::invalidate" + rest}));
  EXPECT_NE(await(letters->fetch("first")), nullptr);
}

// Lazy work

TEST_F(HostTest, LazyWorkCreatesTheStoresThatNobodyAskedFor) {
  auto host = start();
  host->manager("media");
  EXPECT_EQ(directory.names("caches/_sessionlessStore"), std::vector<std::string>{"tmp"});
  host->lazyWork()->dispatchNow();
  host.reset();
  EXPECT_EQ(directory.names("caches/_sessionlessStore"),
            (std::vector<std::string>{"pages_en_US_v3", "thumbs_250_v1", "tmp"}));
}

TEST_F(HostTest, LazyWorkIsReleasedAfterItsDelay) {
  const auto queues = std::make_shared<ManualQueueFactory>();
  HostOptions manual = options();
  manual.taskQueueFactory = queues;
  manual.lazyDelaySeconds = 7;
  Host host(std::move(manual));
  host.manager("media");
  queues->runAll();
  EXPECT_FALSE(directory.exists("caches/_sessionlessStore/thumbs_250_v1"));
  EXPECT_TRUE(queues->workQueue(0)->fireTimer(7'000'000'000));
  queues->runAll();
  EXPECT_TRUE(directory.exists("caches/_sessionlessStore/thumbs_250_v1"));
}

TEST_F(HostTest, DirectoriesOfUnmanagedStoresAreMeasuredWithTheLazyWork) {
  start()->store<UnmanagedStore>("thumbs");
  directory.write("caches/_sessionlessStore/thumbs_250_v1/a", "12345");
  directory.write("caches/_sessionlessStore/thumbs_250_v1/b/c", "678");
  const auto queues = std::make_shared<ManualQueueFactory>();
  const auto events = std::make_shared<EventLog>();
  HostOptions observed = options();
  observed.taskQueueFactory = queues;
  observed.analytics = std::make_unique<test::RecordingAnalytics>(events);
  Host host(std::move(observed));
  const std::string path = host.store<UnmanagedStore>("thumbs")->path;
  host.lazyWork()->dispatchNow();
  queues->runAll();
  EXPECT_EQ(host.sizes()->fetchDirectorySize(path), 8);
  EXPECT_EQ(events->named("qzdisk_size_calculator_logging").size(), 2U);  // the directory and the one inside
}

TEST_F(HostTest, ManagersThatAreBuiltAfterTheLazyWorkAreMeasuredToo) {
  start()->store<UnmanagedStore>("files");
  directory.write("documents/_store_/files_v1/file", "1234567");
  const auto queues = std::make_shared<ManualQueueFactory>();
  HostOptions manual = options();
  manual.taskQueueFactory = queues;
  Host host(std::move(manual));
  host.lazyWork()->dispatchNow();
  host.manager("archive");
  queues->runAll();
  EXPECT_EQ(host.sizes()->fetchDirectorySize(directory.file("documents/_store_/files_v1")), 7);
}

TEST_F(HostTest, ASinkMayAskForTheManagerWhoseMeasuringItHearsOf) {
  const Watchdog watchdog(kLongEnough);
  start()->store<UnmanagedStore>("thumbs");
  const auto queues = std::make_shared<ManualQueueFactory>();
  int answers = 0;
  std::unique_ptr<Host> host;
  HostOptions observed = optionsWith(nullptr, queues);
  observed.analytics = std::make_unique<CallingSink>([&] {
    if (host->manager("media")->isValid()) ++answers;
  });
  host = std::make_unique<Host>(std::move(observed));
  host->lazyWork()->dispatchNow();
  host->manager("media");
  EXPECT_EQ(answers, 0);
  queues->runAll();
  EXPECT_GT(answers, 0);
}

TEST_F(HostTest, ReportsGoToTheSink) {
  HostOptions observed = options();
  observed.analytics = std::make_unique<JsonLinesAnalytics>(directory.file("events"));
  Host host(std::move(observed));
  ASSERT_NE(host.analytics(), nullptr);
  host.store<UnmanagedStore>("thumbs");
  const std::string written = directory.read("events");
  const JsonValue event = JsonValue::parse(written.substr(0, written.find('\n')));
  EXPECT_EQ(event.at("event"), "qzdiskstore_logging");
  EXPECT_EQ(event.at("payload").at("store_name"), "thumbs");
}

// The end

TEST_F(HostTest, DestroyingTheHostKeepsTheData) {
  start()->store<UnmanagedStore>("letters", "alice");
  directory.write("caches/_store_alice/letters_v1/letter", "kept");
  start()->store<UnmanagedStore>("letters", "alice");
  EXPECT_EQ(directory.read("caches/_store_alice/letters_v1/letter"), "kept");
}

TEST_F(HostTest, DestroyingTheHostFinishesWhatIsQueuedAndWhatThatQueues) {
  auto host = start();
  const auto file = host->queues()->createQueue();
  const auto work = host->queues()->createWorkQueue();
  std::atomic<int> ran{0};
  for (int i = 0; i < 50; ++i) {
    work->dispatch([&] {
      ++ran;
      file->dispatch([&] { ++ran; });
    });
  }
  host.reset();
  EXPECT_EQ(ran, 100);
}

TEST_F(HostTest, ThePatienceMayHaveAnyLength) {
  const Watchdog watchdog(kLongEnough);
  const LogCapture log;
  HostOptions patient = options();
  patient.shutDownPatience = std::chrono::seconds::max();
  patient.lazyDelaySeconds = std::numeric_limits<long>::max();
  auto host = std::make_unique<Host>(std::move(patient));
  host->manager("media");
  const auto file = host->queues()->createQueue();
  const auto work = host->queues()->createWorkQueue();
  Latch begun(1);
  std::atomic<int> ran{0};
  work->dispatch([&] {
    begun.wait();
    file->dispatch([&] { ++ran; });
  });
  std::thread ending([&] { host.reset(); });
  const auto isRefused = [&] {
    return errorOf<std::future_error>([&] { dispatchTask<void>(file, [] {}).get(); }) != "no error";
  };
  while (!isRefused()) std::this_thread::yield();
  begun.countDown();
  ending.join();
  EXPECT_EQ(ran, 1);
  EXPECT_TRUE(log.messages().empty());
  EXPECT_EQ(directory.names("caches/_sessionlessStore"), std::vector<std::string>{"tmp"});  // the lazy work was not due
}

TEST_F(HostTest, DestroyingTheHostRefusesNewWorkAndFinishesWhatItHadAccepted) {
  const Watchdog watchdog(kLongEnough);
  HostOptions patient = options();
  patient.shutDownPatience = kLongPatience;
  auto host = std::make_unique<Host>(std::move(patient));
  const auto first = host->queues()->createQueue();
  const auto second = host->queues()->createWorkQueue();
  Latch begun(1);
  Latch gate(1);
  std::atomic<int> ran{0};
  first->dispatch([&] {
    begun.countDown();
    gate.wait();
    second->dispatch([&] { first->dispatch([&] { ++ran; }); });
  });
  begun.wait();
  std::thread ending([&] { host.reset(); });
  const auto isRefused = [&] {
    return errorOf<std::future_error>([&] { dispatchTask<void>(second, [] {}).get(); }) != "no error";
  };
  while (!isRefused()) std::this_thread::yield();
  EXPECT_EQ(ran, 0);
  gate.countDown();
  ending.join();
  EXPECT_EQ(ran, 1);
}

// Without an end to the new work the destructor waits for as long as its patience lasts, and then loses values.
TEST_F(HostTest, DestroyingTheHostUnderLoadEndsPromptlyAndLosesNoValue) {
  const Watchdog watchdog(kLongEnough);
  constexpr std::size_t keys = 50;
  HostOptions patient = options();
  patient.configuration = kConfigurationOfValues;
  patient.shutDownPatience = kLongPatience;
  auto host = std::make_unique<Host>(std::move(patient));
  const auto letters = host->store<PersistentKeyValueStore>("letters");
  for (std::size_t key = 0; key < keys; ++key) await(letters->store("key" + std::to_string(key), {1}));

  Latch busy(2);
  std::vector<std::thread> threads;
  for (std::size_t thread = 0; thread < 2; ++thread) {
    threads.emplace_back([&] {
      std::vector<Future<void>> writes;
      for (std::size_t i = 0; true; ++i) {
        writes.push_back(letters->store("key" + std::to_string(i % keys), {2}));
        if (i < 100) continue;
        busy.countDown();
        try {
          await(writes[i - 100]);
        } catch (const std::future_error&) {
          return;
        }
      }
    });
  }
  busy.wait();
  host.reset();
  for (std::thread& thread : threads) thread.join();

  HostOptions again = options();
  again.configuration = kConfigurationOfValues;
  host = std::make_unique<Host>(std::move(again));
  const auto reopened = host->store<PersistentKeyValueStore>("letters");
  for (std::size_t key = 0; key < keys; ++key) {
    EXPECT_NE(await(reopened->fetch("key" + std::to_string(key))), nullptr) << key;
  }
}

TEST_F(HostTest, DestroyingTheHostDropsTheLazyWork) {
  auto host = start();
  host->manager("media");
  host.reset();
  EXPECT_EQ(directory.names("caches/_sessionlessStore"), std::vector<std::string>{"tmp"});
}

TEST_F(HostTest, WhatIsHeldAfterTheHostDoesNoMoreWork) {
  auto host = start();
  const auto media = host->manager("media");
  const auto thumbs = host->store<UnmanagedStore>("thumbs");
  const auto queue = host->queues()->createQueue();
  host.reset();
  EXPECT_TRUE(media->isValid());
  EXPECT_EQ(media->getTemporaryDirectory(), directory.file("caches/_sessionlessStore/tmp"));
  EXPECT_EQ(thumbs->path, directory.file("caches/_sessionlessStore/thumbs_250_v1"));
  EXPECT_THROW(static_cast<void>(await(dispatchTask<void>(queue, [] {}))), std::future_error);
}

TEST_F(HostTest, AManagerThatIsHeldAfterTheHostMayStillBeInvalidated) {
  auto host = start();
  const auto media = host->manager("media");
  host.reset();
  media->invalidate();
  EXPECT_FALSE(media->isValid());
  EXPECT_FALSE(directory.exists("caches/_sessionlessStore"));
}

TEST_F(HostTest, WorkThatIsStuckIsLeftBehindAfterThePatience) {
  const LogCapture log;
  HostOptions impatient = options();
  impatient.shutDownPatience = std::chrono::seconds(0);
  auto host = std::make_unique<Host>(std::move(impatient));
  const auto queue = host->queues()->createQueue();
  Latch begun(1);
  const auto gate = std::make_shared<Latch>(1);
  const auto over = std::make_shared<Latch>(1);
  queue->dispatch([&begun, gate, over] {
    begun.countDown();
    gate->wait();
    over->countDown();
  });
  begun.wait();
  host.reset();
  EXPECT_EQ(log.messages(), std::vector<std::string>{"Host destroyed with work pending; its threads were detached."});
  EXPECT_FALSE(over->isOpen());
  EXPECT_TRUE(start()->manager("media")->isValid());  // they do not keep the root
  gate->countDown();
  over->wait();
}

TEST_F(HostTest, TheHostMayBeDestroyedByATaskOfItsOwnQueue) {
  std::shared_ptr<Host> host = start();
  host->store<UnmanagedStore>("thumbs");
  const auto queue = host->queues()->createQueue();
  const auto destroyed = std::make_shared<Latch>(1);
  const auto released = std::make_shared<Latch>(1);
  queue->dispatch([released, destroyed, host]() mutable {
    released->wait();
    host.reset();
    destroyed->countDown();
  });
  host.reset();
  released->countDown();
  destroyed->wait();
  EXPECT_TRUE(directory.exists("caches/_sessionlessStore/thumbs_250_v1"));
}

// Each of these writes needs a file queue, and then the work queue that the host is destroyed on.
TEST_F(HostTest, DestroyedOnAQueueOfItsOwnItLosesNoValueAndKeepsTheRootUntilThen) {
  const Watchdog watchdog(kLongEnough);
  const LogCapture log;
  constexpr std::size_t keys = 50;
  const auto startWithValues = [this] {
    HostOptions patient = options();
    patient.configuration = kConfigurationOfValues;
    patient.shutDownPatience = kLongPatience;
    return std::make_shared<Host>(std::move(patient));
  };
  auto host = startWithValues();
  auto letters = host->store<PersistentKeyValueStore>("letters");
  const auto queue = host->queues()->createWorkQueue();
  std::vector<Future<void>> writes;
  int codeOfAnother = 0;
  Latch destroyed(1);
  Latch gate(1);
  std::atomic<bool> isOver{false};
  queue->dispatch([&, host = std::move(host), letters = std::move(letters)]() mutable {
    for (std::size_t key = 0; key < keys; ++key) writes.push_back(letters->store("key" + std::to_string(key), {1}));
    letters.reset();
    host.reset();
    codeOfAnother = codeOf(startWithValues);
    destroyed.countDown();
    gate.wait();
    isOver = true;
  });
  destroyed.wait();
  EXPECT_EQ(codeOfAnother, EWOULDBLOCK);
  EXPECT_THROW(static_cast<void>(await(dispatchTask<void>(queue, [] {}))), std::future_error);
  std::thread opener([&] { gate.countDown(); });
  host = startWithValues();
  opener.join();
  EXPECT_TRUE(isOver);

  for (const auto& write : writes) EXPECT_NO_THROW(await(write));
  const auto reopened = host->store<PersistentKeyValueStore>("letters");
  for (std::size_t key = 0; key < keys; ++key) {
    EXPECT_NE(await(reopened->fetch("key" + std::to_string(key))), nullptr) << key;
  }
  EXPECT_TRUE(log.messages().empty());
}

TEST_F(HostTest, DestroyedOnAQueueOfItsOwnItWaitsForNoLongerThanItsPatience) {
  const Watchdog watchdog(kLongEnough);
  const LogCapture log;
  HostOptions impatient = options();
  impatient.shutDownPatience = std::chrono::seconds(0);
  auto host = std::make_shared<Host>(std::move(impatient));
  const auto queue = host->queues()->createQueue();
  const auto destroyed = std::make_shared<Latch>(1);
  const auto gate = std::make_shared<Latch>(1);
  const auto over = std::make_shared<Latch>(1);
  queue->dispatch([destroyed, gate, over, host = std::move(host)]() mutable {
    host.reset();
    destroyed->countDown();
    gate->wait();
    over->countDown();
  });
  destroyed->wait();
  start();
  EXPECT_EQ(log.messages(), std::vector<std::string>{"Host destroyed with work pending; its threads were detached."});
  EXPECT_FALSE(over->isOpen());
  gate->countDown();
  over->wait();
}

TEST_F(HostTest, QueuesThatWereBroughtAlongAreNotWaitedForAndGoOn) {
  const auto queues = std::make_shared<ManualQueueFactory>();
  HostOptions manual = options();
  manual.taskQueueFactory = queues;
  auto host = std::make_unique<Host>(std::move(manual));
  EXPECT_EQ(host->queues(), queues);
  host->manager("media");
  host.reset();
  for (const auto& queue : queues->all()) EXPECT_TRUE(queue->armedDelays().empty());
  EXPECT_GT(queues->runAll(), 0U);  // the cleanup that the manager had queued
  EXPECT_EQ(directory.names("caches/_sessionlessStore"), std::vector<std::string>{"tmp"});
}

TEST_F(HostTest, QueuesMayBeSharedWithTheApplication) {
  const auto queues = std::make_shared<ThreadQueueFactory>();
  HostOptions shared = options();
  shared.taskQueueFactory = queues;
  auto host = std::make_unique<Host>(std::move(shared));
  host->store<UnmanagedStore>("thumbs");
  host.reset();
  bool ran = false;
  await(dispatchTask<void>(queues->createQueue(), [&] { ran = true; }));
  EXPECT_TRUE(ran);
  EXPECT_TRUE(queues->drain(kLongPatience));
}

TEST_F(HostTest, FilesGoThroughTheFileUtilitiesThatWereBroughtAlong) {
  const auto files = std::make_shared<FaultyFileUtils>();
  HostOptions recorded = options();
  recorded.fileUtils = files;
  Host host(std::move(recorded));
  EXPECT_EQ(host.files(), files);
  host.store<UnmanagedStore>("thumbs");
  EXPECT_GT(files->calls(FaultyFileUtils::Operation::CreateDirectory), 0U);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
