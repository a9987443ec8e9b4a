// A session that is ended by an application that has not opened it, with each of its file operations failing in turn:
// either its data is gone, or somebody was told that it is not.

#include <gtest/gtest.h>

#include <cerrno>
#include <cstddef>
#include <exception>
#include <iostream>
#include <memory>
#include <string>
#include <utility>

#include "PersistentKeyValueStore.h"
#include "faults/ScriptedWorkload.h"
#include "host/Await.h"
#include "host/Host.h"
#include "host/testing/FaultyFileUtils.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

const char* const kConfiguration = R"({
  "inbox": {"area": "documents", "stores": {"drafts": {"type": "pkvs"}}},
  "media": {"stores": {"covers": {"type": "pkvs", "inline_data": true}}}
})";

class EndedSession : public testing::Test {
 protected:
  std::unique_ptr<host::Host> start(const std::string& root, std::shared_ptr<FileUtils> files = nullptr) const {
    host::HostOptions options;
    options.configuration = kConfiguration;
    options.root = root;
    options.fileUtils = std::move(files);
    return std::make_unique<host::Host>(std::move(options));
  }

  static void fill(host::Host& host) {
    for (const char* name : {"drafts", "covers"}) {
      host::await(host.store<PersistentKeyValueStore>(name, "alice")->store("key", bytesOf("hers")));
    }
  }

  // Whether ending it says that it has.
  bool end(const std::string& root, const std::shared_ptr<FaultyFileUtils>& files, std::size_t n) const {
    try {
      const auto host = start(root, files);
      files->failNth(n, EIO);
      return host->logOut("alice");
    } catch (const std::exception&) {
      return false;
    }
  }

  void expectNothingIsLeft(const std::string& root) const {
    const auto host = start(root);
    EXPECT_TRUE(host->sessions().empty());
    for (const char* name : {"drafts", "covers"}) {
      EXPECT_EQ(host::await(host->store<PersistentKeyValueStore>(name, "alice")->fetch("key")), nullptr) << name;
    }
  }
};

TEST_F(EndedSession, IsGoneOrIsSaidNotToBeWhateverFails) {
  const Watchdog watchdog(120);
  for (std::size_t n = 1; !HasFailure(); ++n) {
    const testing::ScopedTrace trace(__FILE__, __LINE__, "n = " + std::to_string(n));
    const TemporaryDirectory directory(quickPlace());
    fill(*start(directory.path()));
    const auto files = std::make_shared<FaultyFileUtils>();
    const bool isEnded = end(directory.path(), files, n);
    if (isEnded) expectNothingIsLeft(directory.path());
    if (files->failures() > 0) continue;
    EXPECT_TRUE(isEnded);
    std::cout << "ending a session: " << n - 1 << " faults\n";
    break;
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
