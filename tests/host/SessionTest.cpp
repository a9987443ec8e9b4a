#include "host/Session.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cstddef>
#include <cstdint>
#include <filesystem>
#include <fstream>
#include <functional>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "LarderException.h"
#include "PersistentKeyValueStore.h"
#include "StoreManager.h"
#include "host/Await.h"
#include "host/Host.h"
#include "host/testing/FaultyFileUtils.h"
#include "support/Barrier.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using test::FaultyFileUtils;
using test::runOnThreads;
using test::TemporaryDirectory;

using Bytes = std::vector<unsigned char>;

const char* const kConfiguration = R"({
  "web": {"session_scoped": false, "stores": {"pages": {"type": "pkvs"}}},
  "inbox": {"stores": {"letters": {"type": "pkvs"}, "files": {"type": "unmanaged"}}},
  "archive": {"area": "documents", "stores": {"drafts": {"type": "pkvs"}}}
})";

class SessionTest : public testing::Test {
 protected:
  HostOptions options(Accounts accounts) const {
    HostOptions options;
    options.configuration = kConfiguration;
    options.root = directory.path();
    options.accounts = accounts;
    options.lazyDelaySeconds = 3600;
    return options;
  }

  std::unique_ptr<Host> start(Accounts accounts = Accounts::Kept) const {
    return std::make_unique<Host>(options(accounts));
  }

  static void put(const Session& session, const std::string& store, const std::string& text) {
    await(session.store<PersistentKeyValueStore>(store)->store("key", Bytes(text.begin(), text.end())));
  }

  static std::string get(const Session& session, const std::string& store) {
    const auto found = await(session.store<PersistentKeyValueStore>(store)->fetch("key"));
    return found == nullptr ? "nothing" : std::string(found->value.begin(), found->value.end());
  }

  static std::vector<std::string> tagsOf(const std::vector<StoredSession>& sessions) {
    std::vector<std::string> tags;
    for (const StoredSession& session : sessions) tags.push_back(session.tag);
    return tags;
  }

  template <class Error> static std::string errorOf(const std::function<void()>& request) {
    try {
      request();
    } catch (const Error& error) {
      return error.what();
    }
    return "no error";
  }

  const TemporaryDirectory directory;
};

TEST_F(SessionTest, SeveralAreOpenAtATimeAndHaveTheirOwnValues) {
  const auto host = start();
  const Session alice = host->openSession("alice");
  const Session bob = host->openSession("bob");
  put(alice, "letters", "of alice");
  put(bob, "letters", "of bob");
  EXPECT_EQ(get(alice, "letters"), "of alice");
  EXPECT_EQ(get(bob, "letters"), "of bob");
  EXPECT_EQ(alice.key(), "alice");
  EXPECT_TRUE(alice.isOpen());
  EXPECT_TRUE(bob.isOpen());
}

TEST_F(SessionTest, EachHasAreasOfItsOwnAndWhatHasNoSessionIsShared) {
  const auto host = start();
  const Session alice = host->openSession("Al/ice");
  alice.manager("inbox");
  alice.manager("archive");
  EXPECT_EQ(alice.manager("web"), host->openSession("bob").manager("web"));
  EXPECT_EQ(alice.store<PersistentKeyValueStore>("pages"), host->store<PersistentKeyValueStore>("pages"));
  EXPECT_TRUE(directory.exists("_cellar_accounts/of_%41l%2fice/caches/_store_%41l%2fice"));
  EXPECT_TRUE(directory.exists("_cellar_accounts/of_%41l%2fice/documents/_store_%41l%2fice"));
  EXPECT_EQ(directory.names("caches"), std::vector<std::string>{"_sessionlessStore"});
}

TEST_F(SessionTest, MaintenanceLeavesTheOthersAlone) {
  put(start()->openSession("alice"), "letters", "of alice");
  {
    const auto host = start();
    put(host->openSession("bob"), "letters", "of bob");
    put(host->openSession("bob"), "drafts", "of bob");
  }
  const auto host = start();
  EXPECT_EQ(get(host->openSession("alice"), "letters"), "of alice");
  EXPECT_EQ(get(host->openSession("bob"), "drafts"), "of bob");
}

TEST_F(SessionTest, EndingOneDiscardsItsDataAndLeavesTheOthers) {
  const auto host = start();
  const Session alice = host->openSession("alice");
  const Session bob = host->openSession("bob");
  put(alice, "letters", "of alice");
  put(alice, "drafts", "of alice");
  put(bob, "letters", "of bob");
  const auto letters = alice.store<PersistentKeyValueStore>("letters");
  EXPECT_TRUE(alice.end());
  EXPECT_FALSE(alice.isOpen());
  EXPECT_FALSE(directory.exists("_cellar_accounts/of_alice"));
  EXPECT_THROW(static_cast<void>(await(letters->fetch("key"))), InvalidatedException);
  EXPECT_EQ(get(bob, "letters"), "of bob");
}

TEST_F(SessionTest, OneThatHasEndedRefusesEverythingAndEndsOnce) {
  const auto host = start();
  const Session alice = host->openSession("alice");
  put(alice, "letters", "first");
  EXPECT_TRUE(alice.end());
  const std::string ended = InvalidatedException("The session of tag 'alice' has ended.").what();
  EXPECT_EQ(errorOf<InvalidatedException>([&] { alice.manager("inbox"); }), ended);
  EXPECT_EQ(errorOf<InvalidatedException>([&] { alice.manager("web"); }), ended);
  EXPECT_EQ(errorOf<InvalidatedException>([&] { alice.store<PersistentKeyValueStore>("letters"); }), ended);
  EXPECT_FALSE(alice.end());
}

TEST_F(SessionTest, OneThatIsOpenedAgainIsAnotherWhichTheFormerDoesNotEnd) {
  const auto host = start();
  const Session former = host->openSession("alice");
  put(former, "letters", "first");
  former.end();
  const Session latter = host->openSession("alice");
  EXPECT_EQ(get(latter, "letters"), "nothing");
  put(latter, "letters", "second");
  EXPECT_FALSE(former.end());
  EXPECT_FALSE(former.isOpen());
  EXPECT_EQ(get(latter, "letters"), "second");
}

TEST_F(SessionTest, ARequestWithoutAKeyMeansTheOnlyOneAndIsRefusedIfThereAreSeveral) {
  const auto host = start();
  const Session alice = host->openSession("alice");
  EXPECT_EQ(host->manager("inbox"), alice.manager("inbox"));
  const Session bob = host->openSession("bob");
  const std::string several = "Several sessions are open, name the one you mean.";
  EXPECT_EQ(errorOf<std::logic_error>([&] { host->manager("inbox"); }), several);
  EXPECT_EQ(errorOf<std::logic_error>([&] { host->logOut(); }), several);
  EXPECT_TRUE(alice.isOpen());
  alice.end();
  EXPECT_EQ(host->manager("inbox"), bob.manager("inbox"));
  host->logOut();
  EXPECT_FALSE(bob.isOpen());
}

TEST_F(SessionTest, WithoutAnyARequestWithoutAKeyOpensTheEmptyOne) {
  const auto host = start();
  host->manager("inbox");
  EXPECT_TRUE(directory.exists("_cellar_accounts/of_/caches/_store_"));
  EXPECT_EQ(host->manager("inbox"), host->openSession("").manager("inbox"));
}

TEST_F(SessionTest, LoggingOutByKeyEndsAnOpenOneAndDiscardsOneOfAnEarlierRun) {
  put(start()->openSession("alice"), "letters", "of alice");
  const auto host = start();
  const Session bob = host->openSession("bob");
  put(bob, "letters", "of bob");
  EXPECT_TRUE(host->logOut("alice"));
  EXPECT_FALSE(host->logOut("alice"));
  EXPECT_FALSE(directory.exists("_cellar_accounts/of_alice"));
  EXPECT_TRUE(bob.isOpen());
  EXPECT_TRUE(host->logOut("bob"));
  EXPECT_FALSE(bob.isOpen());
}

TEST_F(SessionTest, InvalidatingTheHostEndsAll) {
  const auto host = start();
  const Session alice = host->openSession("alice");
  const Session bob = host->openSession("bob");
  put(alice, "letters", "of alice");
  put(bob, "drafts", "of bob");
  put(bob, "pages", "of everybody");
  host->invalidate();
  EXPECT_FALSE(alice.isOpen());
  EXPECT_FALSE(bob.isOpen());
  EXPECT_TRUE(host->sessions().empty());
  EXPECT_EQ(get(host->openSession("bob"), "pages"), "nothing");
}

TEST_F(SessionTest, TwoKeysOfOneNameAreNotOpenTogether) {
  HostOptions mapped = options(Accounts::Kept);
  mapped.sessionTagMapper = [](const std::string& /*key*/) { return "same"; };
  Host host(std::move(mapped));
  const Session alice = host.openSession("alice");
  EXPECT_EQ(errorOf<std::logic_error>([&] { static_cast<void>(host.openSession("bob")); }),
            "Another session that would have the same directories, of tag 'same', is open.");
  EXPECT_TRUE(alice.isOpen());
  alice.end();
  EXPECT_TRUE(host.openSession("bob").isOpen());
}

TEST_F(SessionTest, AKeyThatCannotNameADirectoryOpensNone) {
  const auto host = start();
  EXPECT_THROW(static_cast<void>(host->openSession(std::string(1000, 'A'))), std::length_error);
  EXPECT_TRUE(host->openSession("alice").isOpen());
}

TEST_F(SessionTest, SizesAreThoseOfAllFilesOfASession) {
  const auto host = start();
  const Session alice = host->openSession("alice");
  std::ofstream(alice.store<UnmanagedStore>("files")->path + "/big") << std::string(5000, 'x');
  std::filesystem::create_directory(alice.store<UnmanagedStore>("files")->path + "/deeper");
  std::ofstream(alice.store<UnmanagedStore>("files")->path + "/deeper/small") << "123";
  std::filesystem::create_symlink("/", alice.store<UnmanagedStore>("files")->path + "/link");
  const Session bob = host->openSession("bob");
  std::filesystem::create_directories(directory.file("_cellar_accounts/of_bob/caches/_store_bob"));
  const auto measured = host->sessions(SessionSizes::Measured);
  ASSERT_EQ(tagsOf(measured), (std::vector<std::string>{"alice", "bob"}));
  EXPECT_EQ(measured[0].key, "alice");
  EXPECT_EQ(measured[0].bytes, std::optional<std::uint64_t>(5003));
  EXPECT_EQ(measured[1].bytes, std::optional<std::uint64_t>(0));
  EXPECT_EQ(host->sessions()[0].bytes, std::nullopt);
}

// From one rule to the other

TEST_F(SessionTest, TheDataOfBeforeIsFoundWhenAccountsAreKept) {
  {
    const auto before = start(Accounts::OneAtATime);
    put(before->openSession("alice"), "letters", "of alice");
    put(before->openSession("alice"), "drafts", "of alice");
  }
  const auto host = start();
  EXPECT_EQ(tagsOf(host->sessions()), std::vector<std::string>{"alice"});
  const Session bob = host->openSession("bob");
  put(bob, "letters", "of bob");
  const Session alice = host->openSession("alice");
  EXPECT_EQ(get(alice, "letters"), "of alice");
  EXPECT_EQ(get(alice, "drafts"), "of alice");
  EXPECT_FALSE(directory.exists("caches/_store_alice"));
  EXPECT_EQ(get(bob, "letters"), "of bob");
}

TEST_F(SessionTest, TheDataOfAnAccountIsFoundWhenOneIsOpenAtATimeAgain) {
  {
    const auto before = start();
    put(before->openSession("alice"), "letters", "of alice");
    put(before->openSession("bob"), "letters", "of bob");
  }
  const auto host = start(Accounts::OneAtATime);
  const Session alice = host->openSession("alice");
  EXPECT_EQ(get(alice, "letters"), "of alice");
  EXPECT_TRUE(directory.exists("caches/_store_alice"));
  EXPECT_EQ(errorOf<std::logic_error>([&] { static_cast<void>(host->openSession("bob")); }),
            "Another session is open, log out before you ask for a new one.");
  EXPECT_EQ(tagsOf(host->sessions()), (std::vector<std::string>{"alice", "bob"}));
  EXPECT_TRUE(host->logOut("bob"));
  EXPECT_FALSE(directory.exists("_cellar_accounts/of_bob"));
  alice.end();
  EXPECT_TRUE(host->sessions().empty());
}

TEST_F(SessionTest, DataInBothPlacesStaysAndIsDiscardedTogether) {
  put(start(Accounts::OneAtATime)->openSession("alice"), "letters", "former");
  std::filesystem::create_directories(directory.file("_cellar_accounts/of_alice/caches/_store_alice"));
  const auto host = start();
  const Session alice = host->openSession("alice");
  EXPECT_EQ(get(alice, "letters"), "nothing");
  EXPECT_TRUE(directory.exists("caches/_store_alice"));
  alice.end();
  EXPECT_FALSE(directory.exists("caches/_store_alice"));
  EXPECT_TRUE(host->sessions().empty());
}

TEST_F(SessionTest, AMoveThatFailsFailsTheRequestAndTheNextOneTriesAgain) {
  put(start(Accounts::OneAtATime)->openSession("alice"), "letters", "of alice");
  const auto files = std::make_shared<FaultyFileUtils>();
  HostOptions faulty = options(Accounts::Kept);
  faulty.fileUtils = files;
  std::atomic<bool> fails{true};
  files->onCall = [&](FaultyFileUtils::Operation operation, const std::string& path) {
    if (fails && operation == FaultyFileUtils::Operation::Rename && path == directory.file("caches/_store_alice")) {
      throw FileUtilsIoException(28, "No space left on device");
    }
  };
  Host host(std::move(faulty));
  const Session alice = host.openSession("alice");
  EXPECT_THROW(alice.manager("inbox"), FileUtilsIoException);
  EXPECT_TRUE(directory.exists("caches/_store_alice"));
  fails = false;
  EXPECT_EQ(get(alice, "letters"), "of alice");
}

TEST_F(SessionTest, NothingRemainsOfAnAccountWhoseDataHasMovedBack) {
  put(start()->openSession("alice"), "letters", "of alice");
  const auto host = start(Accounts::OneAtATime);
  host->openSession("alice").manager("inbox");
  EXPECT_FALSE(directory.exists("_cellar_accounts/of_alice"));
}

TEST_F(SessionTest, ALinkInThePlaceOfBeforeIsNotMoved) {
  std::filesystem::create_directories(directory.file("elsewhere"));
  std::filesystem::create_directories(directory.file("caches"));
  std::filesystem::create_symlink("../elsewhere", directory.file("caches/_store_alice"));
  const auto host = start();
  EXPECT_THROW(host->openSession("alice").manager("inbox"), FileUtilsIoException);
  EXPECT_TRUE(std::filesystem::is_symlink(directory.file("caches/_store_alice")));
  EXPECT_TRUE(host->logOut("alice"));
  EXPECT_NO_THROW(host->openSession("alice").manager("inbox"));
}

TEST_F(SessionTest, AFileWhereAccountsWouldBeIsInNobodysWay) {
  std::ofstream(directory.file("_cellar_accounts")) << "a file";
  const auto host = start(Accounts::OneAtATime);
  put(host->openSession("alice"), "letters", "of alice");
  EXPECT_EQ(tagsOf(host->sessions()), std::vector<std::string>{"alice"});
  EXPECT_TRUE(host->logOut("alice"));
  EXPECT_TRUE(host->sessions().empty());
}

TEST_F(SessionTest, InvalidatingTheHostGoesOnWhenTheDataOfOneCannotBeDiscarded) {
  const auto files = std::make_shared<FaultyFileUtils>();
  HostOptions faulty = options(Accounts::Kept);
  faulty.fileUtils = files;
  std::atomic<bool> fails{false};
  files->onCall = [&](FaultyFileUtils::Operation operation, const std::string& path) {
    if (fails && operation == FaultyFileUtils::Operation::Rename &&
        path == directory.file("_cellar_accounts/of_alice")) {
      throw FileUtilsIoException(5, "Input/output error");
    }
  };
  Host host(std::move(faulty));
  const Session alice = host.openSession("alice");
  const Session bob = host.openSession("bob");
  put(alice, "letters", "of alice");
  put(bob, "letters", "of bob");
  put(bob, "pages", "of everybody");
  const auto pages = host.manager("web");
  fails = true;
  EXPECT_THROW(host.invalidate(), FileUtilsIoException);
  EXPECT_FALSE(alice.isOpen());
  EXPECT_FALSE(bob.isOpen());
  EXPECT_FALSE(pages->isValid());
  EXPECT_EQ(tagsOf(host.sessions()), std::vector<std::string>{"alice"});
}

// Beside each other

TEST_F(SessionTest, OneEndsWhileOthersAreOpenedAndUsed) {
  const auto host = start();
  std::atomic<int> wrong{0};
  runOnThreads(3, [&](std::size_t thread) {
    const std::string key = "session" + std::to_string(thread);
    for (int round = 0; round < 10; ++round) {
      const Session session = host->openSession(key);
      put(session, "letters", key);
      if (get(session, "letters") != key) ++wrong;
      if (!session.end()) ++wrong;
    }
  });
  EXPECT_EQ(wrong, 0);
  EXPECT_TRUE(host->sessions().empty());
}

TEST_F(SessionTest, OfManyThatEndASessionAtOnceOneDoes) {
  const auto host = start();
  for (int round = 0; round < 10; ++round) {
    const Session session = host->openSession("alice");
    put(session, "letters", "of alice");
    std::atomic<int> ended{0};
    runOnThreads(4, [&] { ended += session.end() ? 1 : 0; });
    EXPECT_EQ(ended, 1);
    EXPECT_FALSE(session.isOpen());
  }
}

TEST_F(SessionTest, EndingOnAThreadOfTheHostIsRefusedAndChangesNothing) {
  const auto host = start();
  const Session alice = host->openSession("alice");
  const auto queue = host->queues()->createQueue();
  const auto end = [&] { return errorOf<std::logic_error>([&] { alice.end(); }); };
  EXPECT_EQ(await(dispatchTask<std::string>(queue, end)),
            "Session::end may deadlock on a thread of the host kit's queues. Use a thread of your own instead.");
  EXPECT_TRUE(alice.isOpen());
}

TEST_F(SessionTest, WithOneAtATimeTheObjectFollowsTheSameRule) {
  const auto host = start(Accounts::OneAtATime);
  const Session alice = host->openSession("alice");
  EXPECT_EQ(alice.manager("inbox"), host->manager("inbox"));
  EXPECT_THROW(static_cast<void>(host->openSession("bob")), std::logic_error);
  host->logOut();
  EXPECT_FALSE(alice.isOpen());
  EXPECT_TRUE(host->openSession("bob").isOpen());
  EXPECT_THROW(alice.manager("inbox"), InvalidatedException);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
