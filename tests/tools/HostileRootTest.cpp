#include <fcntl.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstdint>
#include <cstring>
#include <filesystem>
#include <string>
#include <vector>

#include "inspect/Survey.h"
#include "storage/ConfiguredStores.h"
#include "storage/Layout.h"
#include "storage/StoreFiles.h"
#include "storage/UntouchedFiles.h"
#include "tools/StoredData.h"
#include "verify/Verification.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using test::StoredData;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::UnorderedElementsAre;

namespace fs = std::filesystem;

const std::string kManager = "caches/_sessionlessStore";
const std::string kThumbs = kManager + "/thumbs_v1";
const std::string kSound = kManager + "/sound_v1";
const std::string kManifest = kThumbs + "/manifest_v1.sqlite";
const std::string kAttributes = kManager + "/web_v1/_cellar_extended_attributes";
constexpr std::uintmax_t kHuge = std::uintmax_t{100} << 30U;

// Roots that somebody has made who means no good. Beside what is hostile there is a store that is shown all the same.
class HostileRoot : public testing::Test {
 protected:
  HostileRoot() {
    data_.putItem(kSound, "a", "value");
    data_.putItem(kThumbs, "b", "value");
    data_.putFile(kManager + "/web_v1/page", "x");
  }

  std::vector<std::string> verified(bool repair = false) {
    std::vector<std::string> lines;
    verify(
        findLayout(data_.root()), repair, [](std::uint64_t) {},
        [&](const std::string& line) { lines.push_back(line); });
    return lines;
  }

  // "path: reason", after a look at whether the sound store is there.
  std::vector<std::string> unreadable() {
    const Survey survey =
        makeSurvey(findLayout(data_.root()), ConfiguredStores(), 5, StoredData::kNow, [](std::uint64_t) {});
    bool isSoundThere = false;
    for (const ManagerSurvey& manager : survey.managers) {
      for (const StoreSurvey& store : manager.stores) isSoundThere |= store.path == kSound && store.items == 1;
    }
    EXPECT_TRUE(isSoundThere);
    std::vector<std::string> lines;
    for (const Unreadable& part : survey.unreadable) lines.push_back(part.path + ": " + part.reason);
    return lines;
  }

  // Inspecting and verifying say the same, and repairing says that it has repaired nothing.
  void expectUnreadable(const std::string& path, const std::string& reason) {
    SCOPED_TRACE(path);
    EXPECT_THAT(unreadable(), ElementsAre(path + ": " + reason));
    EXPECT_THAT(verified(), ElementsAre(path + ": cannot be read: " + reason));
    EXPECT_THAT(verified(true),
                ElementsAre(path + ": cannot be read: " + reason + "; NOT REPAIRED: it may be readable later"));
  }

  void makeFifo(const std::string& below) const { ASSERT_EQ(mkfifo(data_.path(below).c_str(), 0600), 0); }

  void makeSocket(const std::string& below) const {
    const std::string path = data_.path(below);
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    ASSERT_LT(path.size(), sizeof address.sun_path);
    std::memcpy(static_cast<char*>(address.sun_path), path.c_str(), path.size() + 1);
    const int socket = ::socket(AF_UNIX, SOCK_STREAM, 0);
    EXPECT_EQ(bind(socket, reinterpret_cast<const sockaddr*>(&address), sizeof address), 0);
    close(socket);
  }

  void makeLink(const std::string& target, const std::string& below) const {
    fs::create_symlink(target, data_.path(below));
  }

  void makeHuge(const std::string& below) {
    data_.putFile(below, "");
    fs::resize_file(data_.path(below), kHuge);
  }

  void remove(const std::string& below) const { fs::remove(data_.path(below)); }

  StoredData data_;
};

TEST_F(HostileRoot, WithASpecialFileBesideAManifestIsShownButForThatStore) {
  for (const char* const suffix : {"-wal", "-journal"}) {
    const std::string path = kManifest + suffix;
    makeFifo(path);
    expectUnreadable(path, "not a regular file");
    remove(path);
    makeSocket(path);
    expectUnreadable(path, "not a regular file");
    remove(path);
    makeLink("/dev/zero", path);
    expectUnreadable(path, "not a regular file");
    remove(path);
    makeLink(data_.path(kSound + "/a"), path);
    expectUnreadable(path, "it is a link");
    remove(path);
    fs::create_directory(data_.path(path));
    expectUnreadable(path, "not a regular file");
    remove(path);
  }
}

TEST_F(HostileRoot, WithASpecialFileInThePlaceOfAManifestSaysSo) {
  remove(kManifest);
  makeFifo(kManifest);
  expectUnreadable(kManifest, "not a regular file");
  remove(kManifest);
  makeLink("/dev/zero", kManifest);
  expectUnreadable(kManifest, "it is a link");
}

TEST_F(HostileRoot, WithASpecialFileInThePlaceOfAttributesSaysSo) {
  makeFifo(kAttributes);
  expectUnreadable(kAttributes, "not a regular file");
  remove(kAttributes);
  makeLink("/dev/zero", kAttributes);
  expectUnreadable(kAttributes, "not a regular file");
  remove(kAttributes);
  makeLink(data_.path(kSound + "/a"), kAttributes);
  expectUnreadable(kAttributes, "it is a link");
}

TEST_F(HostileRoot, WithFilesThatAreTooLargeReadsNothingOfThem) {
  makeHuge(kManifest);
  expectUnreadable(kManifest, "more than the 1.0 GB that are read of such a file");
  remove(kManifest);
  makeHuge(kAttributes);
  expectUnreadable(kAttributes, "more than the 4.0 MB that are read of such a file");
}

TEST_F(HostileRoot, WithALogThatIsTooLargeReadsNothingOfIt) {
  makeHuge(kManifest + "-wal");
  expectUnreadable(kManifest + "-wal", "more than the 1.0 GB that are read of such a file");
}

TEST_F(HostileRoot, WithSpecialFilesAmongTheValuesReadsNoneOfThem) {
  makeFifo(kThumbs + "/fifo");
  makeSocket(kThumbs + "/socket");
  data_.putRecord(kThumbs, {"zero", "zero", 4, false, 1, 1, nullptr});
  makeLink("/dev/zero", kThumbs + "/zero");
  EXPECT_THAT(unreadable(), IsEmpty());
  EXPECT_THAT(verified(), UnorderedElementsAre(kThumbs + ": record without file: 'zero' (4 bytes recorded)",
                                               kThumbs + ": file without record: 'fifo' (0 bytes)",
                                               kThumbs + ": file without record: 'socket' (0 bytes)",
                                               kThumbs + ": file without record: 'zero' (0 bytes)"));
}

TEST_F(HostileRoot, KeepsTheRecordOfAValueThatMayBeThere) {
  const std::string name(300, 'n');
  data_.putRecord(kThumbs, {"key", name, 4, false, 1, 1, nullptr});
  const std::string path = data_.path(kThumbs + "/" + name);
  const std::string line = kThumbs + ": unreadable value: 'key': cannot read '" + path + "': File name too long";
  EXPECT_THAT(verified(), ElementsAre(line));
  EXPECT_THAT(verified(true), ElementsAre(line + "; NOT REPAIRED: it may be readable later"));
  EXPECT_EQ(data_.rows(kThumbs).size(), 2U);
}

TEST_F(HostileRoot, WithAttributesOfManyLevelsIsRead) {
  const std::size_t levels = 100'000;
  data_.putFile(kAttributes, std::string(levels, '[') + std::string(levels, ']'));
  EXPECT_THAT(unreadable(), IsEmpty());
  EXPECT_THAT(verified(), IsEmpty());
  data_.putFile(kAttributes, std::string(levels, '['));
  EXPECT_EQ(verified().size(), 1U);
}

TEST_F(HostileRoot, WithADirectoryThatVanishesIsWalkedOn) {
  std::vector<std::string> seen;
  std::vector<std::string> missed;
  data_.putFile(kManager + "/web_v1/deep/page", "x");
  const std::string web = data_.path(kManager + "/web_v1");
  const auto onEntry = [&](const std::string& below, const Entry&) {
    seen.push_back(below);
    if (below == "deep") fs::remove_all(web + "/deep");
  };
  walkTree(web, onEntry, [&](const Unreadable& part) { missed.push_back(part.path + ": " + part.reason); });
  EXPECT_THAT(seen, ElementsAre("deep", "page"));
  EXPECT_THAT(missed, ElementsAre(web + "/deep: No such file or directory"));
  EXPECT_THROW(walkTree(web + "/deep", onEntry), UnreadableException);
}

TEST_F(HostileRoot, WithADirectoryThatIsReplacedByALinkIsNotLeft) {
  std::vector<std::string> missed;
  const std::string web = data_.path(kManager + "/web_v1");
  data_.putFile(kManager + "/web_v1/deep/page", "x");
  const auto onEntry = [&](const std::string& below, const Entry&) {
    if (below != "deep") return;
    fs::remove_all(web + "/deep");
    fs::create_symlink(data_.path(kSound), web + "/deep");
  };
  walkTree(web, onEntry, [&](const Unreadable& part) { missed.push_back(part.path); });
  EXPECT_THAT(missed, ElementsAre(web + "/deep"));
}

TEST(UntouchedFiles, ReadsAFileThatHasNoSizeUntilItsEnd) {
  EXPECT_FALSE(UntouchedFiles().readFile("/proc/self/status").empty());
  EXPECT_THROW(UntouchedFiles(5).readFile("/proc/self/status"), UnreadableException);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
