#include "host/Errors.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cerrno>
#include <cstddef>
#include <future>
#include <memory>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "LarderException.h"
#include "Store.h"
#include "host/Await.h"
#include "host/Host.h"
#include "host/ThreadQueueFactory.h"
#include "host/testing/FaultyFileUtils.h"
#include "support/Barrier.h"
#include "support/KeyValueStoreFixture.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using std::string;
using test::hasNested;
using test::isA;
using test::whatOf;
using testing::HasSubstr;
using testing::Not;
using testing::StartsWith;

template <class Operation> std::exception_ptr failureOf(const Operation& operation) {
  try {
    operation();
    return nullptr;
  } catch (...) {
    return std::current_exception();
  }
}

// --- naming ---

class Naming : public test::KeyValueStoreFixture {
 protected:
  Naming() { open(); }

  template <class T> std::exception_ptr failureOfNaming(const std::exception_ptr& failure, const string& key) const {
    Promise<T> promise;
    const auto named = naming(promise.getFuture(), *store, key);
    promise.setException(failure);
    return failureOf([&] { (void)await(named); });
  }

  const string culprit = "Store 'store', key 'x', " + directory.file("store") + ": ";
};

TEST_F(Naming, PassesOnAValue) {
  Promise<std::unique_ptr<int>> promise;
  auto named = naming(promise.getFuture(), *store, "x");
  EXPECT_FALSE(named.isReady());
  promise.setValue(std::make_unique<int>(7));
  EXPECT_EQ(*await(named), 7);
  Promise<void> nothing;
  nothing.setValue();
  EXPECT_NO_THROW(await(naming(nothing.getFuture(), *store)));
}

TEST_F(Naming, NamesTheStoreTheKeyAndThePathOfAFailedFetch) {
  put("x", "value");
  files->failNext(test::Operation::ReadFile, EIO);
  const auto fetched = naming(store->fetch("x"), *store, "x");
  settle();
  try {
    (void)await(fetched);
    FAIL() << "It cannot be read.";
  } catch (const StoreError& error) {
    EXPECT_EQ(error.store(), "store");
    EXPECT_EQ(error.key(), "x");
    EXPECT_EQ(error.path(), store->path);
    try {
      std::rethrow_if_nested(error);
      FAIL() << "The library's own error is there.";
    } catch (const FileUtilsIoException& own) {
      EXPECT_EQ(own.code(), EIO);
      EXPECT_EQ(error.what(), culprit + own.what());
    }
  }
}

TEST_F(Naming, LeavesOutAKeyThatThereIsNot) {
  const auto failure = failureOfNaming<void>(std::make_exception_ptr(std::runtime_error("text")), "");
  EXPECT_EQ(whatOf(failure), "Store 'store', " + store->path + ": text");
}

TEST_F(Naming, ShowsALongOrOddKeyShortAndReadableAndHasItInFull) {
  const string key = string("\n", 1) + string(100, 'k');
  const auto failure = failureOfNaming<int>(std::make_exception_ptr(42), key);
  EXPECT_EQ(whatOf(failure),
            "Store 'store', key '\\x0a" + string(79, 'k') + "...', " + store->path + ": not a standard exception");
  EXPECT_TRUE(hasNested<int>(failure));
  try {
    std::rethrow_exception(failure);
  } catch (const StoreError& error) {
    EXPECT_EQ(error.key(), key);
  }
}

TEST_F(Naming, KeepsTheTypeOfWhatSaysThatSomethingHasEnded) {
  const auto invalid =
      failureOfNaming<void>(std::make_exception_ptr(InvalidatedException("Store has been invalidated.")), "x");
  EXPECT_TRUE(isA<InvalidatedException>(invalid));
  EXPECT_TRUE(hasNested<InvalidatedException>(invalid));
  EXPECT_THAT(whatOf(invalid), HasSubstr("description: " + culprit + "Store has been invalidated. ."));

  Future<void> broken;
  { broken = naming(Promise<void>().getFuture(), *store, "x"); }
  EXPECT_TRUE(isA<std::future_error>(failureOf([&] { await(broken); })));
}

TEST_F(Naming, NamesNothingTwice) {
  const auto failure = failureOfNaming<void>(std::make_exception_ptr(std::runtime_error("text")), "x");
  EXPECT_EQ(failureOfNaming<void>(failure, "y"), failure);
  const auto invalid = failureOfNaming<void>(std::make_exception_ptr(InvalidatedException("text")), "x");
  EXPECT_EQ(whatOf(failureOfNaming<void>(invalid, "y")), whatOf(invalid));
}

TEST_F(Naming, TheStoreMayBeGoneByThen) {
  Promise<void> promise;
  const auto named = naming(promise.getFuture(), *store, "x");
  close();
  promise.setException(std::make_exception_ptr(std::runtime_error("text")));
  EXPECT_EQ(whatOf(failureOf([&] { await(named); })), culprit + "text");
}

TEST_F(Naming, RefusesAFutureThatHasNoValueToGive) {
  EXPECT_THROW((void)naming(Future<void>(), *store, "x"), FutureMisuseError);
}

TEST_F(Naming, ManyThreadsMayFailAtOnce) {
  std::vector<Promise<void>> promises(100);
  std::vector<Future<void>> named;
  named.reserve(promises.size());
  for (auto& promise : promises) named.push_back(naming(promise.getFuture(), *store, "x"));
  const auto failure = std::make_exception_ptr(std::runtime_error("text"));
  test::runOnThreads(4, [&](std::size_t thread) {
    for (std::size_t i = thread; i < promises.size(); i += 4) {
      promises[i].setException(failure);  // all threads nest the same exception
      EXPECT_EQ(whatOf(failureOf([&] { await(named[i]); })), culprit + "text");
    }
  });
}

// --- Building managers and stores ---

class HostErrors : public testing::Test {
 protected:
  HostErrors() {
    HostOptions options;
    options.configuration = R"({
      "media": {"session_scoped": false, "stores": {"thumbs": {"type": "pkvs"}}},
      "inbox": {"stores": {"letters": {"type": "pkvs"}}}})";
    options.root = directory.path();
    options.fileUtils = files;
    options.sessionTagMapper = [](const string& key) { return "tag" + std::to_string(key.size()); };
    options.lazyDelaySeconds = 3600;
    host = std::make_unique<Host>(std::move(options));
  }

  // What the error says, which must be a file error with that code and the original nested in it.
  template <class Request> static string refusalOf(int code, const Request& request) {
    const auto failure = failureOf(request);
    EXPECT_TRUE(hasNested<FileUtilsIoException>(failure));
    try {
      if (failure != nullptr) std::rethrow_exception(failure);
    } catch (const FileUtilsIoException& error) {
      EXPECT_EQ(error.code(), code);
      return error.description();
    }
    return "no error";
  }

  const test::TemporaryDirectory directory;
  const std::shared_ptr<test::FaultyFileUtils> files = std::make_shared<test::FaultyFileUtils>();
  std::unique_ptr<Host> host;
};

TEST_F(HostErrors, AStoreThatCannotBeBuiltIsNamedWithItsManagerAndPath) {
  const string path = directory.file("caches/_sessionlessStore/thumbs__v1");
  files->failPath(test::Operation::CreateDirectory, path, ENOSPC);
  EXPECT_THAT(refusalOf(ENOSPC, [&] { host->store<Store>("thumbs"); }),
              StartsWith("Store 'thumbs' of manager 'media', " + path + ": "));
}

TEST_F(HostErrors, AManagerThatCannotBeBuiltIsNamedWithItsPath) {
  files->failAlways(test::Operation::CreateDirectory, EIO);
  const string culprit = "Manager 'media', " + directory.file("caches/_sessionlessStore") + ": ";
  EXPECT_THAT(refusalOf(EIO, [&] { host->manager("media"); }), StartsWith(culprit));
  EXPECT_THAT(refusalOf(EIO, [&] { host->store<Store>("thumbs"); }), StartsWith(culprit));
}

TEST_F(HostErrors, ASessionIsNamedByItsTagAndNeverByItsKey) {
  const Session session = host->openSession("secret");
  const string path = directory.file("caches/_store_tag6/letters__v1");
  files->failPath(test::Operation::CreateDirectory, path, EIO);
  const string ofStore = refusalOf(EIO, [&] { session.store<Store>("letters"); });
  EXPECT_THAT(ofStore, StartsWith("Store 'letters' of manager 'inbox', " + path + ": "));
  EXPECT_THAT(ofStore, Not(HasSubstr("secret")));
  session.end();
  files->failAlways(test::Operation::CreateDirectory, EIO);
  const Session next = host->openSession("secret");
  const string ofManager = refusalOf(EIO, [&] { next.manager("inbox"); });
  EXPECT_THAT(ofManager, StartsWith("Manager 'inbox', " + directory.file("caches/_store_tag6") + ": "));
  EXPECT_THAT(ofManager, Not(HasSubstr("secret")));
}

// A file layer of the host's own may throw anything.
TEST(HostErrorsOfForeignFiles, AreStoreErrors) {
  class Files : public FileUtils {
   public:
    void createDirectory(const string& path, bool intermediate) override {
      if (path.find(refused) != string::npos) throw std::runtime_error("No card.");
      FileUtils::createDirectory(path, intermediate);
    }
    string refused = "thumbs";
  };
  const test::TemporaryDirectory directory;
  const auto files = std::make_shared<Files>();
  HostOptions options;
  options.configuration = R"({"media": {"session_scoped": false, "stores": {"thumbs": {"type": "unmanaged"}}}})";
  options.root = directory.path();
  options.fileUtils = files;
  Host host(std::move(options));
  const auto told = [&] {
    try {
      host.store<Store>("thumbs");
    } catch (const StoreError& error) {
      EXPECT_TRUE(hasNested<std::runtime_error>(std::current_exception()));
      return error.store() + "|" + error.path() + "|" + error.what();
    }
    return string("no error");
  };
  const string manager = directory.file("caches/_sessionlessStore");
  files->refused = "_sessionlessStore";
  EXPECT_EQ(told(), "|" + manager + "|Manager 'media', " + manager + ": No card.");
  files->refused = "thumbs";
  const string store = manager + "/thumbs__v1";
  EXPECT_EQ(told(), "thumbs|" + store + "|Store 'thumbs' of manager 'media', " + store + ": No card.");
}

TEST_F(HostErrors, RequestsThatAreWrongThrowWhatTheyAlwaysDid) {
  EXPECT_THROW(host->store<Store>("unknown"), ConfigurationException);
  EXPECT_THROW(host->manager("unknown"), ConfigurationException);
  EXPECT_THROW(host->store<UnmanagedStore>("thumbs"), std::logic_error);
  const Session session = host->openSession("alice");
  EXPECT_THROW(host->store<Store>("letters", "robert"), std::logic_error);
  session.end();
  EXPECT_THROW(session.store<Store>("letters"), InvalidatedException);
  EXPECT_THROW(session.manager("inbox"), InvalidatedException);
  host->manager("media")->invalidate();
  EXPECT_THROW(host->store<Store>("thumbs"), InvalidatedException);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
