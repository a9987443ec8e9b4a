#include "inspect/Watch.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>

#include <csignal>
#include <filesystem>
#include <sstream>
#include <string>

#include "Console.h"
#include "StopSignals.h"
#include "inspect/Survey.h"
#include "storage/ConfiguredStores.h"
#include "storage/Layout.h"
#include "tools/StoredData.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using test::StoredData;
using testing::AllOf;
using testing::ContainsRegex;
using testing::HasSubstr;
using testing::Not;
using testing::StartsWith;

const std::string kThumbs = "caches/_sessionlessStore/thumbs_v1";
const std::string kWeb = "caches/_sessionlessStore/web_v1";

class Watching : public testing::Test {
 protected:
  // What is shown now, and not what was shown before.
  std::string look() {
    stream_.str("");
    watch_.show(makeSurvey(
        findLayout(data_.root()), ConfiguredStores(), 0, StoredData::kNow, [](std::uint64_t) {}, true));
    return stream_.str();
  }

  StoredData data_;
  std::ostringstream stream_;
  Console console_{stream_, false, false};
  Watch watch_{console_};
};

TEST_F(Watching, CountsWhatHasComeAndGoneSinceTheFirstLook) {
  data_.putItem(kThumbs, "a", "one");
  data_.putItem(kThumbs, "b", "two");
  data_.putFile(kWeb + "/page", "p");
  EXPECT_THAT(look(), ContainsRegex("thumbs_v1 +2 +0 +0 +6 B"));

  data_.putItem(kThumbs, "c", "three");
  data_.run(kThumbs, "DELETE FROM LarderManifest WHERE key = 'a';");
  std::filesystem::remove(data_.path(kWeb + "/page"));
  const std::string second = look();
  EXPECT_THAT(second, ContainsRegex("thumbs_v1 +2 +1 +1 "));
  EXPECT_THAT(second, ContainsRegex("web_v1 +0 +0 +1 "));

  data_.putItem(kThumbs, "b", "two again");  // neither has come nor gone
  data_.putItem(kThumbs, "a", "one");
  EXPECT_THAT(look(), ContainsRegex("thumbs_v1 +3 +2 +1 "));
}

TEST_F(Watching, AllItemsOfANewStoreHaveCome) {
  data_.putItem(kThumbs, "a", "one");
  (void)look();
  data_.putFile(kWeb + "/page", "p");
  EXPECT_THAT(look(), ContainsRegex("web_v1 +1 +1 +0 "));
}

TEST_F(Watching, AManifestThatIsRefusedForOneLookChangesNoCount) {
  data_.putItem(kThumbs, "a", "one");
  data_.putRecord(kThumbs, {"key", "file", 3, false, 1, 1, nullptr});
  data_.putFile(kThumbs + "/file", "two");
  (void)look();
  const std::string log = data_.path(kThumbs) + "/manifest_v1.sqlite-journal";
  ASSERT_EQ(::mkfifo(log.c_str(), 0600), 0);
  EXPECT_THAT(look(), AllOf(ContainsRegex("thumbs_v1 +2 +0 +0 "), HasSubstr("1 part not readable")));
  std::filesystem::remove(log);
  EXPECT_THAT(look(), ContainsRegex("thumbs_v1 +2 +0 +0 "));
}

TEST_F(Watching, SomethingElseInPlaceOfTheManifestChangesNoCount) {
  data_.putItem(kThumbs, "a", "one");
  (void)look();
  const std::string manifest = data_.path(kThumbs) + "/manifest_v1.sqlite";
  const std::string kept = data_.directory().file("kept");
  std::filesystem::rename(manifest, kept);
  ASSERT_EQ(::mkfifo(manifest.c_str(), 0600), 0);
  EXPECT_THAT(look(), AllOf(ContainsRegex("thumbs_v1 +[0-9]+ +0 +0 "), HasSubstr("1 part not readable")));
  std::filesystem::remove(manifest);
  std::filesystem::rename(kept, manifest);
  EXPECT_THAT(look(), ContainsRegex("thumbs_v1 +1 +0 +0 "));
}

TEST_F(Watching, AManifestThatCannotBeReadChangesNoCount) {
  data_.putItem(kThumbs, "a", "one");
  const std::string manifest = data_.path(kThumbs) + "/manifest_v1.sqlite";
  const std::string kept = data_.directory().file("kept");
  std::filesystem::rename(manifest, kept);
  data_.putFile(kThumbs + "/manifest_v1.sqlite", std::string(8192, 'x'));
  EXPECT_THAT(look(), HasSubstr("thumbs_v1: the manifest is damaged, or was written to while it was read"));
  std::filesystem::rename(kept, manifest);
  EXPECT_THAT(look(), ContainsRegex("thumbs_v1 +1 +0 +0 "));
  data_.putFile(kThumbs + "/manifest_v1.sqlite", std::string(8192, 'x'));
  EXPECT_THAT(look(), ContainsRegex("thumbs_v1 +[0-9]+ +0 +0 "));
}

TEST_F(Watching, ReplacesTheScreenOfATerminalAlone) {
  data_.putItem(kThumbs, "a", "one");
  EXPECT_THAT(look(), Not(HasSubstr("\x1b")));
  std::ostringstream stream;
  Console terminal(stream, true, false);
  Watch(terminal).show(
      makeSurvey(findLayout(data_.root()), ConfiguredStores(), 0, StoredData::kNow, [](std::uint64_t) {}));
  EXPECT_THAT(stream.str(), StartsWith("\x1b[H\x1b[2J"));
}

TEST(StopSignals, EndAWaitAndAreNotLost) {
  for (const int signal : {SIGINT, SIGTERM}) {
    const StopSignals stop;
    EXPECT_FALSE(stop.comeWithin(0));
    ASSERT_EQ(::raise(signal), 0);
    EXPECT_TRUE(stop.comeWithin(3600));
    EXPECT_FALSE(stop.comeWithin(0));
  }
}

TEST(StopSignals, InterruptWhatLooksForThem) {
  const StopSignals stop;
  EXPECT_NO_THROW(stop.throwIfCome());
  ASSERT_EQ(::raise(SIGTERM), 0);
  try {
    stop.throwIfCome();
    FAIL() << "The signal was not seen.";
  } catch (const Interrupted& by) {
    EXPECT_EQ(by.signal, SIGTERM);
  }
  EXPECT_NO_THROW(stop.throwIfCome());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
