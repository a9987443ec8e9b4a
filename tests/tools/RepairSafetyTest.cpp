// What a repair does not do: touch what is in use, or what a link leads to.

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#include <cellar/SQLiteManifestPersistence.h>
#include <cellar/host/RootLock.h>

#include "InputError.h"
#include "inspect/Survey.h"
#include "storage/ConfiguredStores.h"
#include "storage/Layout.h"
#include "tools/StoredData.h"
#include "verify/Verification.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using test::StoredData;
using testing::ElementsAre;
using testing::EndsWith;
using testing::HasSubstr;
using testing::IsEmpty;

namespace fs = std::filesystem;

const std::string kManager = "caches/_sessionlessStore";
const std::string kThumbs = kManager + "/thumbs_v1";
const std::string kManifest = kThumbs + "/manifest_v1.sqlite";
const std::string kOfAccount = "_cellar_accounts/of_alice/caches/_store_alice/drafts_v1";

class RepairSafety : public testing::Test {
 protected:
  RepairSafety() {
    data_.putItem(kThumbs, "a", "value");
    data_.putFile(kThumbs + "/stray", "precious");
    elsewhere_ = data_.directory().makeDirectory("elsewhere");
  }

  std::vector<std::string> verified(bool repair, const std::string& below = "") {
    std::vector<std::string> lines;
    result_ = verify(
        findLayout(data_.path(below)), repair, [](std::uint64_t) {},
        [&](const std::string& line) { lines.push_back(line); });
    return lines;
  }

  // Why it is not even begun.
  std::string refusal(const std::string& below = "") {
    try {
      verified(true, below);
    } catch (const InputError& error) {
      return error.what();
    }
    return "";
  }

  bool exists(const std::string& below) const { return data_.directory().exists("root/" + below); }
  void makeLink(const std::string& target, const std::string& below) const {
    fs::create_directories(fs::path(data_.path(below)).parent_path());
    fs::create_symlink(target, data_.path(below));
  }

  void expectNothingElsewhere() const { EXPECT_THAT(data_.directory().names("elsewhere"), IsEmpty()); }

  void recordWithoutFile() { data_.putRecord(kThumbs, {"lost", "lost", 4, false, 1, 1, nullptr}); }

  StoredData data_;
  VerificationResult result_;
  std::string elsewhere_;
};

// A process that has a manifest open until the end of the test.
class Application {
 public:
  explicit Application(const std::string& manifest) {
    std::array<int, 2> ready{};
    EXPECT_EQ(pipe(ready.data()), 0);
    EXPECT_EQ(pipe(end_.data()), 0);
    id_ = fork();
    char byte = 0;
    if (id_ == 0) {
      close(end_[1]);
      const SQLiteManifestPersistence persistence(manifest, nullptr, nullptr);
      (void)!write(ready[1], &byte, 1);
      (void)!read(end_[0], &byte, 1);
      _exit(0);
    }
    close(end_[0]);
    EXPECT_EQ(read(ready[0], &byte, 1), 1);
    close(ready[0]);
    close(ready[1]);
  }
  ~Application() {
    close(end_[1]);
    waitpid(id_, nullptr, 0);
  }
  Application(const Application&) = delete;
  Application& operator=(const Application&) = delete;

  std::string id() const { return std::to_string(id_); }

 private:
  std::array<int, 2> end_{};
  pid_t id_ = 0;
};

TEST_F(RepairSafety, RefusesWhileTheRootIsLocked) {
  data_.makeStore(kOfAccount);
  {
    const host::RootLock lock(data_.root());
    const std::string expected =
        "cannot repair: Root '" + data_.root() + "' is in use by process " + std::to_string(getpid()) + ".";
    for (const std::string& below : {std::string(), std::string("caches"), kManager, kThumbs, kOfAccount}) {
      EXPECT_EQ(refusal(below), expected) << below;
    }
    EXPECT_TRUE(exists(kThumbs + "/stray"));
    EXPECT_FALSE(exists("caches/_cellar_quarantine"));
    EXPECT_EQ(verified(false).size(), 1U);
    makeSurvey(findLayout(data_.root()), ConfiguredStores(), 5, 0, [](std::uint64_t) {});
  }
  EXPECT_EQ(verified(true).size(), 1U);
  EXPECT_EQ(result_.repaired, 1U);
  EXPECT_TRUE(result_.isLocked);
}

TEST_F(RepairSafety, TakesNoLockThatIsNotThere) {
  EXPECT_EQ(verified(true).size(), 1U);
  EXPECT_EQ(result_.repaired, 1U);
  EXPECT_FALSE(result_.isLocked);
  EXPECT_FALSE(exists("_cellar_lock"));
}

TEST_F(RepairSafety, LeavesTheLockFreeAndVerifyingTakesNone) {
  data_.putFile("_cellar_lock", "");
  data_.makeReadingVisible();
  const auto before = data_.trace();
  verified(false);
  EXPECT_EQ(data_.trace(), before);
  verified(true);
  const host::RootLock lock(data_.root());
}

TEST_F(RepairSafety, RefusesALockThatIsALink) {
  const std::string target = data_.directory().write("elsewhere/file", "precious");
  makeLink(target, "_cellar_lock");
  EXPECT_THAT(refusal(), HasSubstr("cannot repair: Could not lock"));
  EXPECT_EQ(data_.directory().read("elsewhere/file"), "precious");
  EXPECT_TRUE(exists(kThumbs + "/stray"));
}

TEST_F(RepairSafety, RepairsNothingOfAStoreThatAnotherProcessHasOpen) {
  recordWithoutFile();
  const Application application(data_.path(kManifest));
  const auto lines = verified(true);
  EXPECT_THAT(lines, testing::SizeIs(2));
  EXPECT_THAT(lines, testing::Each(EndsWith("; NOT REPAIRED: process " + application.id() + " has the store open")));
  EXPECT_EQ(data_.rows(kThumbs).size(), 2U);
  EXPECT_TRUE(exists(kThumbs + "/stray"));
}

TEST_F(RepairSafety, DoesNotFollowALinkInThePlaceOfTheQuarantine) {
  makeLink(elsewhere_, "caches/_cellar_quarantine");
  const std::string line = kThumbs + ": file without record: 'stray' (8 bytes); NOT REPAIRED: cannot open '";
  EXPECT_THAT(verified(true), ElementsAre(line + data_.path("caches/_cellar_quarantine") + "': it is a link"));
  expectNothingElsewhere();
  EXPECT_EQ(data_.directory().read("root/" + kThumbs + "/stray"), "precious");
  EXPECT_EQ(result_.repaired, 0U);
}

TEST_F(RepairSafety, DoesNotFollowALinkInTheQuarantine) {
  makeLink(elsewhere_, "caches/_cellar_quarantine/_sessionlessStore");
  EXPECT_THAT(verified(true), ElementsAre(EndsWith("/_sessionlessStore': it is a link")));
  expectNothingElsewhere();
}

TEST_F(RepairSafety, TakesANameInTheQuarantineThatIsALinkForTaken) {
  makeLink(elsewhere_ + "/new", "caches/_cellar_quarantine/_sessionlessStore/thumbs_v1/stray");
  EXPECT_THAT(verified(true), ElementsAre(EndsWith("/thumbs_v1/stray.1")));
  expectNothingElsewhere();
}

TEST_F(RepairSafety, MovesNoValueOutOfALinkedDirectory) {
  data_.directory().write("elsewhere/file", "somebody's");
  makeLink(elsewhere_, kManager + "/safe_v1/linked");
  DiskCacheItem item("key", "linked/file", 10, false, 1, 1, nullptr);
  item.checksum = 0;
  SQLiteManifestPersistence(data_.path(kManager + "/safe_v1/manifest_v1.sqlite"), nullptr, nullptr, Durability::Safe)
      .storeItem(item, nullptr);
  const auto lines = verified(true, kManager + "/safe_v1");
  EXPECT_THAT(lines, testing::Contains(EndsWith("/linked': it is a link")));
  EXPECT_EQ(data_.directory().read("elsewhere/file"), "somebody's");
  EXPECT_EQ(data_.rows(kManager + "/safe_v1").size(), 1U);
}

TEST_F(RepairSafety, WritesNoManifestThroughALink) {
  recordWithoutFile();
  fs::remove(data_.path(kThumbs + "/stray"));
  data_.directory().write("elsewhere/file", "precious");
  makeLink(elsewhere_ + "/file", kManifest + "-shm");
  EXPECT_THAT(verified(true), ElementsAre(EndsWith("/manifest_v1.sqlite-shm' is not a regular file")));
  EXPECT_EQ(data_.directory().read("elsewhere/file"), "precious");
  fs::remove(data_.path(kManifest + "-shm"));
  fs::create_hard_link(data_.path(kManifest), elsewhere_ + "/manifest");
  EXPECT_THAT(verified(true), ElementsAre(EndsWith("/manifest_v1.sqlite' has another name elsewhere")));
  fs::remove(elsewhere_ + "/manifest");
  EXPECT_THAT(verified(true), ElementsAre(EndsWith("; record removed")));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
