#include "DiskSizeCalculator.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstdint>
#include <ctime>
#include <filesystem>
#include <functional>
#include <limits>
#include <memory>
#include <stdexcept>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "AttributeStore.h"
#include "LarderException.h"
#include "host/testing/FaultyFileUtils.h"
#include "host/testing/RecordingAnalytics.h"
#include "support/Barrier.h"
#include "support/LogCapture.h"
#include "support/TemporaryDirectory.h"

namespace {

// What the processor clock shows next, then the times after that: empty for the real clock.
std::vector<std::clock_t> clockReadings;

}  // namespace

// Takes the place of the C library's, as the measuring of a long-lived process cannot be waited for.
extern "C" __attribute__((visibility("default"))) std::clock_t clock() noexcept {
  if (!clockReadings.empty()) {
    const std::clock_t reading = clockReadings.front();
    clockReadings.erase(clockReadings.begin());
    return reading;
  }
  std::timespec used{};
  (void)::clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &used);
  return static_cast<std::clock_t>(std::int64_t{used.tv_sec} * CLOCKS_PER_SEC + used.tv_nsec / 1000);
}

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using test::FaultyFileUtils;
using test::LoggedEvent;
using test::Operation;
using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using Stats = DiskSizeCalculator::Stats;

constexpr long kWeek = 604800;
const string kAttributesFile = "_cellar_extended_attributes";

string ioFailure(int code, const string& text) {
  return "domain: QZLarderIoErrorErrorDomain; code: " + std::to_string(code) + "; description: " + text + " .";
}

// Lists in the order of the paths, so that a test knows what comes first.
class SortedFileUtils : public FaultyFileUtils {
 public:
  std::vector<FileUtils::Info> listDirectory(const string& path) override {
    std::vector<FileUtils::Info> entries = FaultyFileUtils::listDirectory(path);
    std::sort(entries.begin(), entries.end(), [](const auto& a, const auto& b) { return a.path < b.path; });
    return entries;
  }
};

class DiskSizeCalculatorTest : public testing::Test {
 protected:
  // A file of that size, without taking the space.
  string makeFile(const string& name, off_t size) const {
    const string path = directory_.write(name, "");
    if (truncate(path.c_str(), size) != 0) throw std::runtime_error("cannot size " + path);
    return path;
  }

  // The tree "root" with three files of 1, 20 and 300 bytes, one of them in a sub-directory.
  string makeTree() const {
    makeFile("root/a", 1);
    makeFile("root/b", 20);
    makeFile("root/sub/c", 300);
    return directory_.file("root");
  }

  static JsonValue resultOf(long long size, long long fileCount, double timeSpent, std::int64_t timeStamp) {
    return {{"qzDirectorySizeCalculationSize", size},
            {"qzDirectorySizeCalculationFilecount", fileCount},
            {"qzDirectorySizeCalculationTimespent", timeSpent},
            {"qzDirectorySizeCalculationTimestamp", timeStamp}};
  }

  // Gives a directory a kept result that was written so many seconds ago.
  void keep(const string& name, long ageInSeconds, long long size, long long fileCount = 7, double timeSpent = 0.5) {
    const std::int64_t timeStamp = static_cast<std::int64_t>(std::time(nullptr)) - ageInSeconds;
    attributes_->set(directory_.file(name), resultOf(size, fileCount, timeSpent, timeStamp));
  }

  // Runs the steps within one second of the clock, so that ages that are written into the data are exact.
  static void withinOneSecond(const std::function<void()>& steps) {
    std::time_t before = 0;
    do {
      before = std::time(nullptr);
      steps();
    } while (std::time(nullptr) != before);
  }

  static void expectNothing(const Stats& stats, bool valid) {
    EXPECT_EQ(stats.valid, valid);
    EXPECT_EQ(stats.timeSpent, 0.0);
    EXPECT_EQ(stats.fileCount, 0);
    EXPECT_EQ(stats.size, 0);
  }

  JsonValue keptIn(const string& name) const { return JsonValue::parse(directory_.read(name + "/" + kAttributesFile)); }

  bool hasResult(const string& name) const { return directory_.exists(name + "/" + kAttributesFile); }

  std::vector<string> reportedPaths() const {
    std::vector<string> paths;
    for (const LoggedEvent& event : events_->events()) paths.push_back(event.json().at("directory_path"));
    return paths;
  }

  test::TemporaryDirectory directory_;
  std::shared_ptr<SortedFileUtils> files_ = std::make_shared<SortedFileUtils>();
  std::shared_ptr<AttributeStore> attributes_ = std::make_shared<AttributeStore>(files_);
  std::shared_ptr<test::EventLog> events_ = std::make_shared<test::EventLog>();
  DiskSizeCalculator calculator_{files_, attributes_, test::recordingReporter(events_)};
  test::LogCapture log_;
};

TEST(DiskSizeCalculator, ItsConstantsAreFixed) {
  EXPECT_EQ(DiskSizeCalculator::LARGE_FILE_SIZE, 1048576);
  EXPECT_EQ(DiskSizeCalculator::MIN_TIME_SPENT, 1e-09);
  EXPECT_EQ(DiskSizeCalculator::STALE_INTERVAL, 604800);
  EXPECT_EQ(DiskSizeCalculator::ATTR_SIZE, "qzDirectorySizeCalculationSize");
  EXPECT_EQ(DiskSizeCalculator::ATTR_FILE_COUNT, "qzDirectorySizeCalculationFilecount");
  EXPECT_EQ(DiskSizeCalculator::ATTR_TIME_SPENT, "qzDirectorySizeCalculationTimespent");
  EXPECT_EQ(DiskSizeCalculator::ATTR_TIME_STAMP, "qzDirectorySizeCalculationTimestamp");
}

TEST(DiskSizeCalculator, StatsHoldWhatTheyAreBuiltFrom) {
  const Stats stats(true, 1.5, 2, 5LL << 32);
  EXPECT_TRUE(stats.valid);
  EXPECT_EQ(stats.timeSpent, 1.5);
  EXPECT_EQ(stats.fileCount, 2);
  EXPECT_EQ(stats.size, 5LL << 32);
}

// Measuring

TEST_F(DiskSizeCalculatorTest, AFreshMeasurementSumsTheTreeAndIsNotMarkedValid) {
  const Stats stats = calculator_.calculateDirectorySize(makeTree());
  EXPECT_FALSE(stats.valid);
  EXPECT_EQ(stats.fileCount, 3);
  EXPECT_EQ(stats.size, 321);
  EXPECT_GE(stats.timeSpent, 3e-09);
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(DiskSizeCalculatorTest, EveryFileAddsItsMinimumTime) {
  for (const char* name : {"root/1", "root/2", "root/3"}) makeFile(name, 1);
  EXPECT_GE(calculator_.calculateDirectorySize(directory_.file("root")).timeSpent, 3e-09);
}

TEST_F(DiskSizeCalculatorTest, AnEmptyDirectoryHoldsNothingAndIsMeasuredAllTheSame) {
  const Stats stats = calculator_.calculateDirectorySize(directory_.makeDirectory("empty"));
  EXPECT_FALSE(stats.valid);
  EXPECT_EQ(stats.fileCount, 0);
  EXPECT_EQ(stats.size, 0);
  EXPECT_TRUE(hasResult("empty"));
}

TEST_F(DiskSizeCalculatorTest, WhatIsNoDirectoryGivesZerosAndLogsNothing) {
  expectNothing(calculator_.calculateDirectorySize(directory_.file("missing")), false);
  expectNothing(calculator_.calculateDirectorySize(makeFile("file", 5)), false);
  EXPECT_THAT(log_.messages(), IsEmpty());
  EXPECT_EQ(files_->calls(Operation::WriteFile), 0U);
}

TEST_F(DiskSizeCalculatorTest, LinksAreNeitherCountedNorFollowed) {
  makeFile("outside/file", 1000);
  makeFile("root/file", 1);
  std::filesystem::create_symlink("../outside", directory_.file("root/toDirectory"));
  std::filesystem::create_symlink("../outside/file", directory_.file("root/toFile"));
  std::filesystem::create_symlink(".", directory_.file("root/toItself"));
  const Stats stats = calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_EQ(stats.fileCount, 1);
  EXPECT_EQ(stats.size, 1);
  EXPECT_FALSE(hasResult("outside"));
}

TEST_F(DiskSizeCalculatorTest, PipesAreNotCounted) {
  makeFile("root/file", 1);
  ASSERT_EQ(mkfifo(directory_.file("root/fifo").c_str(), 0600), 0);
  EXPECT_EQ(calculator_.calculateDirectorySize(directory_.file("root")).fileCount, 1);
}

TEST_F(DiskSizeCalculatorTest, SizesBeyond32BitsAreSummedExactly) {
  makeFile("root/a", 3LL << 30);
  makeFile("root/b", 3LL << 30);
  EXPECT_EQ(calculator_.calculateDirectorySize(directory_.file("root")).size, 6LL << 30);
  EXPECT_EQ(calculator_.fetchDirectorySize(directory_.file("root")), 6LL << 30);
}

TEST_F(DiskSizeCalculatorTest, SizesAtTheEdgesOf31And32BitsAreSummedExactly) {
  long long total = 0;
  for (const long long size : {1LL << 31, 1LL << 32}) {
    for (const long long difference : {-1, 0, 1}) {
      makeFile("root/" + std::to_string(size + difference), size + difference);
      total += size + difference;
    }
  }
  const Stats stats = calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_EQ(stats.size, total);
  EXPECT_EQ(stats.fileCount, 6);
}

TEST_F(DiskSizeCalculatorTest, AProcessorClockThatBeginsAnewMeanwhileLosesNoTime) {
  using Ticks = std::numeric_limits<std::clock_t>;
  makeFile("root/file", 1);
  clockReadings = {Ticks::max() - 1'999'999, Ticks::min() + 1'000'000};
  const Stats stats = calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_TRUE(clockReadings.empty());
  EXPECT_NEAR(stats.timeSpent, 3.0, 1e-6);
}

TEST_F(DiskSizeCalculatorTest, TheTimeOfNestedDirectoriesCountsOnceForEveryLevel) {
  makeFile("root/sub/file", 1);
  constexpr double busy = 0.004;
  const string slow = directory_.file("root/sub");
  files_->onCall = [&](Operation operation, const string& path) {
    if (operation != Operation::ListDirectory || path != slow) return;
    const std::clock_t start = std::clock();
    while (static_cast<double>(std::clock() - start) < busy * static_cast<double>(CLOCKS_PER_SEC)) {
    }
  };
  const Stats stats = calculator_.calculateDirectorySize(directory_.file("root"));
  const double nested = keptIn("root/sub").at("qzDirectorySizeCalculationTimespent");
  EXPECT_GE(nested, busy);
  EXPECT_GE(stats.timeSpent, 2 * nested - 1e-5);
}

TEST_F(DiskSizeCalculatorTest, TheKeptTimeOfANestedDirectoryIsAdded) {
  makeFile("root/file", 1);
  directory_.makeDirectory("root/sub");
  keep("root/sub", 0, 10, 2, 1000.0);
  const double time = calculator_.calculateDirectorySize(directory_.file("root")).timeSpent;
  EXPECT_GE(time, 1000.0);
  EXPECT_LT(time, 1500.0);
}

TEST_F(DiskSizeCalculatorTest, TheWalkCallsItselfVirtually) {
  class Counting : public DiskSizeCalculator {
   public:
    using DiskSizeCalculator::DiskSizeCalculator;
    Stats traverseDirectory(const string& path, const std::unordered_map<string, long>& directories,
                            const std::unordered_set<string>& excluded) override {
      walked.push_back(path);
      return DiskSizeCalculator::traverseDirectory(path, directories, excluded);
    }
    std::vector<string> walked;
  };
  Counting calculator(files_, attributes_, nullptr);
  calculator.calculateDirectorySize(makeTree());
  EXPECT_THAT(calculator.walked, ElementsAre(directory_.file("root"), directory_.file("root/sub")));
}

TEST_F(DiskSizeCalculatorTest, TheAttributesFileIsCountedByTheNextFullMeasurementUnlessItsNameIsExcluded) {
  makeFile("root/file", 10);
  keep("root", kWeek + 5, 0);
  const auto attributesSize =
      static_cast<long long>(std::filesystem::file_size(directory_.file("root/" + kAttributesFile)));
  const Stats counted = calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_EQ(counted.fileCount, 2);
  EXPECT_EQ(counted.size, 10 + attributesSize);
  keep("root", kWeek + 5, 0);
  calculator_.exclude(kAttributesFile);
  const Stats excluded = calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_EQ(excluded.fileCount, 1);
  EXPECT_EQ(excluded.size, 10);
}

// Keeping results

TEST_F(DiskSizeCalculatorTest, AResultIsKeptWithExactlyItsFourMembers) {
  const auto before = static_cast<std::int64_t>(std::time(nullptr));
  const Stats stats = calculator_.calculateDirectorySize(makeTree());
  const auto after = static_cast<std::int64_t>(std::time(nullptr));
  const JsonValue kept = keptIn("root");
  EXPECT_EQ(kept.size(), 4U);
  EXPECT_TRUE(kept.at("qzDirectorySizeCalculationSize").is_number_integer());
  EXPECT_EQ(kept.at("qzDirectorySizeCalculationSize"), 321);
  EXPECT_TRUE(kept.at("qzDirectorySizeCalculationFilecount").is_number_integer());
  EXPECT_EQ(kept.at("qzDirectorySizeCalculationFilecount"), 3);
  EXPECT_TRUE(kept.at("qzDirectorySizeCalculationTimespent").is_number_float());
  EXPECT_EQ(kept.at("qzDirectorySizeCalculationTimespent").get<double>(), stats.timeSpent);
  EXPECT_TRUE(kept.at("qzDirectorySizeCalculationTimestamp").is_number_integer());
  EXPECT_GE(kept.at("qzDirectorySizeCalculationTimestamp").get<std::int64_t>(), before);
  EXPECT_LE(kept.at("qzDirectorySizeCalculationTimestamp").get<std::int64_t>(), after);
}

TEST_F(DiskSizeCalculatorTest, AResultReplacesWhateverElseTheAttributesHeld) {
  makeFile("root/file", 1);
  attributes_->set(directory_.file("root"), {{"mine", true}});
  calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_FALSE(keptIn("root").contains("mine"));
}

TEST_F(DiskSizeCalculatorTest, EveryDirectoryOfTheTreeKeepsItsOwnResult) {
  calculator_.calculateDirectorySize(makeTree());
  EXPECT_EQ(keptIn("root/sub").at("qzDirectorySizeCalculationSize"), 300);
  EXPECT_EQ(calculator_.fetchDirectorySize(directory_.file("root/sub")), 300);
}

TEST_F(DiskSizeCalculatorTest, AFreshResultIsAnsweredWithoutListingReportingOrWriting) {
  makeTree();
  keep("root", 5, 123456, 7, 0.5);
  calculator_.setAnalytics(true);
  const string before = directory_.read("root/" + kAttributesFile);
  files_->clearTrace();
  const Stats stats = calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_TRUE(stats.valid);
  EXPECT_EQ(stats.size, 123456);
  EXPECT_EQ(stats.fileCount, 7);
  EXPECT_EQ(stats.timeSpent, 0.5);
  EXPECT_EQ(files_->calls(Operation::ListDirectory), 0U);
  EXPECT_EQ(files_->calls(Operation::WriteFile), 0U);
  EXPECT_THAT(events_->events(), IsEmpty());
  EXPECT_EQ(directory_.read("root/" + kAttributesFile), before);
}

TEST_F(DiskSizeCalculatorTest, ASecondMeasurementIsAnsweredFromTheFirst) {
  makeTree();
  const Stats first = calculator_.calculateDirectorySize(directory_.file("root"));
  makeFile("root/new", 1000);
  const Stats second = calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_TRUE(second.valid);
  EXPECT_EQ(second.size, first.size);
  EXPECT_EQ(second.fileCount, first.fileCount);
  EXPECT_EQ(second.timeSpent, first.timeSpent);
}

TEST_F(DiskSizeCalculatorTest, AResultOfExactlySevenDaysIsFreshAndOneSecondMoreIsStale) {
  makeFile("root/file", 1);
  bool fresh = false;
  withinOneSecond([&] {
    keep("root", kWeek, 999);
    fresh = calculator_.calculateDirectorySize(directory_.file("root")).valid;
  });
  EXPECT_TRUE(fresh);
  keep("root", kWeek + 1, 999);
  EXPECT_FALSE(calculator_.calculateDirectorySize(directory_.file("root")).valid);
}

TEST_F(DiskSizeCalculatorTest, ARegisteredIntervalReplacesTheSevenDaysOnBothSides) {
  makeFile("root/file", 1);
  calculator_.addDirectory(directory_.file("root"), 10);
  bool fresh = false;
  withinOneSecond([&] {
    keep("root", 10, 999);
    fresh = calculator_.calculateDirectorySize(directory_.file("root")).valid;
  });
  EXPECT_TRUE(fresh);
  keep("root", 11, 999);
  EXPECT_FALSE(calculator_.calculateDirectorySize(directory_.file("root")).valid);
  calculator_.addDirectory(directory_.file("root"), 2 * kWeek);
  keep("root", kWeek + 100, 999);
  EXPECT_TRUE(calculator_.calculateDirectorySize(directory_.file("root")).valid);
}

TEST_F(DiskSizeCalculatorTest, ARegisteredIntervalCountsForThatDirectoryAlone) {
  makeTree();
  calculator_.addDirectory(directory_.file("root"), 10);
  keep("root", 100, 999);
  keep("root/sub", 100, 5000);
  const Stats stats = calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_FALSE(stats.valid);
  EXPECT_GT(stats.size, 5000);
}

TEST_F(DiskSizeCalculatorTest, ARegisteredIntervalCountsForANestedDirectoryToo) {
  makeTree();
  calculator_.exclude(kAttributesFile);
  calculator_.addDirectory(directory_.file("root/sub"), 10);
  keep("root/sub", 100, 5000);
  EXPECT_EQ(calculator_.calculateDirectorySize(directory_.file("root")).size, 321);
}

TEST_F(DiskSizeCalculatorTest, AnIntervalOfZeroKeepsAResultForItsSecond) {
  makeFile("root/file", 1);
  bool fresh = false;
  withinOneSecond([&] {
    keep("root", 0, 999);
    fresh = calculator_.getCachedStats(directory_.file("root"), 0).valid;
  });
  EXPECT_TRUE(fresh);
  keep("root", 1, 999);
  EXPECT_FALSE(calculator_.getCachedStats(directory_.file("root"), 0).valid);
}

TEST_F(DiskSizeCalculatorTest, ATimeStampInTheFutureIsFresh) {
  makeFile("root/file", 1);
  keep("root", -1000000, 999);
  EXPECT_TRUE(calculator_.calculateDirectorySize(directory_.file("root")).valid);
  attributes_->set(directory_.file("root"), resultOf(999, 1, 0, LLONG_MAX));
  EXPECT_TRUE(calculator_.calculateDirectorySize(directory_.file("root")).valid);
}

TEST_F(DiskSizeCalculatorTest, AResultWithoutAPositiveTimeStampIsNeverUsed) {
  makeFile("root/file", 1);
  for (const std::int64_t timeStamp : {std::int64_t{0}, std::int64_t{-1}, std::int64_t{LLONG_MIN}}) {
    attributes_->set(directory_.file("root"), resultOf(999, 1, 0, timeStamp));
    expectNothing(calculator_.getCachedStats(directory_.file("root"), LONG_MAX), false);
  }
  JsonValue withoutTimeStamp = resultOf(999, 1, 0, 1);
  withoutTimeStamp.erase("qzDirectorySizeCalculationTimestamp");
  attributes_->set(directory_.file("root"), withoutTimeStamp);
  expectNothing(calculator_.getCachedStats(directory_.file("root"), LONG_MAX), false);
}

TEST_F(DiskSizeCalculatorTest, MissingFiguresOfAFreshResultCountAsZero) {
  directory_.makeDirectory("root");
  attributes_->set(directory_.file("root"),
                   {{"qzDirectorySizeCalculationTimestamp", static_cast<std::int64_t>(std::time(nullptr))}});
  expectNothing(calculator_.getCachedStats(directory_.file("root"), kWeek), true);
}

TEST_F(DiskSizeCalculatorTest, ATimeKeptAsAWholeNumberIsATime) {
  directory_.makeDirectory("root");
  JsonValue result = resultOf(5, 1, 0, static_cast<std::int64_t>(std::time(nullptr)));
  result["qzDirectorySizeCalculationTimespent"] = 2;
  attributes_->set(directory_.file("root"), result);
  const Stats stats = calculator_.getCachedStats(directory_.file("root"), kWeek);
  EXPECT_TRUE(stats.valid);
  EXPECT_EQ(stats.timeSpent, 2.0);
}

TEST_F(DiskSizeCalculatorTest, NoResultIsAnInvalidOne) {
  expectNothing(calculator_.getCachedStats(directory_.makeDirectory("root"), kWeek), false);
  expectNothing(calculator_.getCachedStats(directory_.file("missing"), kWeek), false);
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(DiskSizeCalculatorTest, ANestedDirectoryIsAnsweredFromItsOwnResult) {
  makeTree();
  keep("root/sub", 5, 1000000, 50, 0.25);
  const Stats stats = calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_EQ(stats.size, 1000021);
  EXPECT_EQ(stats.fileCount, 52);
  EXPECT_EQ(files_->calls(Operation::ListDirectory), 1U);
}

TEST_F(DiskSizeCalculatorTest, DamagedResultsAreMeasuredAgainAndMended) {
  const std::int64_t now = static_cast<std::int64_t>(std::time(nullptr));
  std::vector<string> damaged = {"[]",   "[1,2]",   "5", R"("text")", "null",
                                 "true", "no json", "",  "{}",        R"({"other":1})"};
  for (const char* key : {"qzDirectorySizeCalculationSize", "qzDirectorySizeCalculationFilecount",
                          "qzDirectorySizeCalculationTimespent", "qzDirectorySizeCalculationTimestamp"}) {
    for (const JsonValue& wrong : {JsonValue("text"), JsonValue(nullptr), JsonValue::array(), JsonValue::object()}) {
      JsonValue result = resultOf(999, 1, 0.5, now);
      result[key] = wrong;
      damaged.push_back(result.dump());
    }
  }
  calculator_.exclude(kAttributesFile);
  makeFile("root/file", 10);
  for (const string& text : damaged) {
    directory_.write("root/" + kAttributesFile, text);
    const Stats stats = calculator_.calculateDirectorySize(directory_.file("root"));
    EXPECT_FALSE(stats.valid) << text;
    EXPECT_EQ(stats.size, 10) << text;
    EXPECT_TRUE(calculator_.calculateDirectorySize(directory_.file("root")).valid) << text;
    EXPECT_EQ(calculator_.fetchDirectorySize(directory_.file("root")), 10) << text;
  }
  EXPECT_FALSE(log_.contains("Cannot calculate directory size."));
}

TEST_F(DiskSizeCalculatorTest, ADamagedResultOfANestedDirectoryDoesNotSpoilTheTree) {
  makeTree();
  calculator_.exclude(kAttributesFile);
  directory_.write("root/sub/" + kAttributesFile, "[]");
  EXPECT_EQ(calculator_.calculateDirectorySize(directory_.file("root")).size, 321);
}

TEST_F(DiskSizeCalculatorTest, KeptFiguresBeyondAllBoundsWrapWhenTheyAreAdded) {
  makeTree();
  keep("root/sub", 0, LLONG_MAX, LLONG_MAX);
  const Stats stats = calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_EQ(stats.size, LLONG_MIN + 20);
  EXPECT_EQ(stats.fileCount, LLONG_MIN + 1);
}

TEST_F(DiskSizeCalculatorTest, AResultThatCannotBeWrittenIsOnlyLost) {
  makeTree();
  files_->failAlways(Operation::WriteFile, ENOSPC);
  const Stats stats = calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_EQ(stats.size, 321);
  EXPECT_FALSE(log_.contains("Cannot calculate directory size."));
  EXPECT_TRUE(log_.contains("Could not set attributes: "));
}

// Fetching

TEST_F(DiskSizeCalculatorTest, FetchingAMissingOrUnmeasuredDirectoryGivesZero) {
  EXPECT_EQ(calculator_.fetchDirectorySize(directory_.file("missing")), 0);
  EXPECT_EQ(calculator_.fetchDirectorySize(makeTree()), 0);
  EXPECT_THAT(log_.messages(), IsEmpty());
  EXPECT_EQ(files_->calls(Operation::ListDirectory), 0U);
}

TEST_F(DiskSizeCalculatorTest, FetchingGivesTheKeptSizeHoweverOld) {
  directory_.makeDirectory("root");
  keep("root", 100 * kWeek, 5LL << 32);
  EXPECT_EQ(calculator_.fetchDirectorySize(directory_.file("root")), 5LL << 32);
  attributes_->set(directory_.file("root"), {{"qzDirectorySizeCalculationSize", 12}});
  EXPECT_EQ(calculator_.fetchDirectorySize(directory_.file("root")), 12);
}

TEST_F(DiskSizeCalculatorTest, FetchingASizeOfTheWrongTypeGivesZeroAndLogs) {
  directory_.makeDirectory("root");
  for (const JsonValue& wrong : {JsonValue("12"), JsonValue(nullptr), JsonValue::array()}) {
    attributes_->set(directory_.file("root"), {{"qzDirectorySizeCalculationSize", wrong}});
    EXPECT_EQ(calculator_.fetchDirectorySize(directory_.file("root")), 0) << wrong;
    EXPECT_THAT(log_.messages().back(), HasSubstr("Cannot fetch directory size. ")) << wrong;
  }
  EXPECT_EQ(log_.errorCount(), 3U);
}

TEST_F(DiskSizeCalculatorTest, FetchingFromADocumentThatIsNoObjectGivesZero) {
  directory_.makeDirectory("root");
  for (const JsonValue& document : {JsonValue(5), JsonValue("text"), JsonValue::array({1}), JsonValue(nullptr)}) {
    attributes_->set(directory_.file("root"), document);
    EXPECT_EQ(calculator_.fetchDirectorySize(directory_.file("root")), 0) << document;
  }
}

TEST_F(DiskSizeCalculatorTest, AFailureOfFetchingIsLoggedAndGivesZero) {
  files_->onCall = [](Operation, const string&) { throw std::logic_error("odd host"); };
  EXPECT_EQ(calculator_.fetchDirectorySize(directory_.path()), 0);
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot fetch directory size. odd host"));
  EXPECT_EQ(log_.errorCount(), 1U);
}

// Failures

TEST_F(DiskSizeCalculatorTest, AFailureDeepInTheTreeDiscardsTheWholeMeasurementButKeepsFinishedResults) {
  makeFile("root/a/file", 5);
  makeFile("root/b/c/file", 6);
  files_->failPath(Operation::ListDirectory, directory_.file("root/b/c"), EIO);
  expectNothing(calculator_.calculateDirectorySize(directory_.file("root")), false);
  EXPECT_THAT(log_.messages(), ElementsAre("Cannot calculate directory size. " + ioFailure(EIO, "Input/output error")));
  EXPECT_EQ(log_.errorCount(), 1U);
  EXPECT_EQ(log_.lines()[0].file, "DiskSizeCalculator.cpp");
  EXPECT_EQ(keptIn("root/a").at("qzDirectorySizeCalculationSize"), 5);
  EXPECT_FALSE(hasResult("root"));
  EXPECT_FALSE(hasResult("root/b"));
}

TEST_F(DiskSizeCalculatorTest, TheWalkItselfThrowsWhatTheFileUtilitiesThrow) {
  makeTree();
  files_->failNext(Operation::ListDirectory, EIO);
  EXPECT_THROW(calculator_.traverseDirectory(directory_.file("root"), {}, {}), FileUtilsIoException);
}

// Exclusion

TEST_F(DiskSizeCalculatorTest, AnExcludedNameLeavesOutFilesAndDirectoriesOfThatNameAtEveryDepth) {
  makeFile("root/skip/file", 1);
  makeFile("root/a/skip", 20);
  makeFile("root/a/b/skip/file", 300);
  makeFile("root/a/keep", 4000);
  makeFile("root/skipped", 50000);
  calculator_.exclude("skip");
  const Stats stats = calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_EQ(stats.size, 54000);
  EXPECT_EQ(stats.fileCount, 2);
  EXPECT_FALSE(hasResult("root/skip"));
}

TEST_F(DiskSizeCalculatorTest, AnExcludedTopDirectoryIsValidlyEmpty) {
  makeTree();
  calculator_.setAnalytics(true);
  calculator_.exclude("root");
  expectNothing(calculator_.calculateDirectorySize(directory_.file("root")), true);
  expectNothing(calculator_.calculateDirectorySize(directory_.file("root/")), true);
  EXPECT_FALSE(hasResult("root"));
  EXPECT_THAT(events_->events(), IsEmpty());
}

TEST_F(DiskSizeCalculatorTest, AFullPathExcludesNothing) {
  makeTree();
  calculator_.exclude(directory_.file("root/sub"));
  calculator_.exclude("root/sub");
  EXPECT_EQ(calculator_.calculateDirectorySize(directory_.file("root")).size, 321);
}

TEST_F(DiskSizeCalculatorTest, SeveralNamesAreExcludedAtOnce) {
  makeTree();
  calculator_.exclude("a");
  calculator_.exclude("sub");
  EXPECT_EQ(calculator_.calculateDirectorySize(directory_.file("root")).size, 20);
}

// Reporting

TEST_F(DiskSizeCalculatorTest, NothingIsReportedUntilAnalyticsAreOn) {
  calculator_.calculateDirectorySize(makeTree());
  EXPECT_THAT(events_->events(), IsEmpty());
  EXPECT_EQ(files_->calls(Operation::GetDiskSpace), 0U);
}

TEST_F(DiskSizeCalculatorTest, AnalyticsCanBeSwitchedOffAgain) {
  calculator_.setAnalytics(true);
  calculator_.setAnalytics(false);
  calculator_.calculateDirectorySize(makeTree());
  EXPECT_THAT(events_->events(), IsEmpty());
}

TEST_F(DiskSizeCalculatorTest, EveryMeasuredDirectoryIsReportedOnceInnerOnesFirst) {
  calculator_.setAnalytics(true);
  calculator_.calculateDirectorySize(makeTree());
  EXPECT_THAT(reportedPaths(), ElementsAre(directory_.file("root/sub"), directory_.file("root")));
}

TEST_F(DiskSizeCalculatorTest, AReportCarriesTheMeasurementAndTheDisk) {
  class KnownDisk : public SortedFileUtils {
   public:
    FileUtils::DiskSpace getDiskSpace(const string&) override { return {1LL << 40, 1LL << 33}; }
  };
  const auto files = std::make_shared<KnownDisk>();
  DiskSizeCalculator calculator(files, attributes_, test::recordingReporter(events_));
  calculator.setAnalytics(true);
  makeFile("root/file", 12);
  const Stats stats = calculator.calculateDirectorySize(directory_.file("root"));
  ASSERT_EQ(events_->named("qzdisk_size_calculator_logging").size(), 1U);
  EXPECT_EQ(events_->events()[0].json(), (JsonValue{{"directory_path", directory_.file("root")},
                                                    {"size", 12},
                                                    {"file_count", 1},
                                                    {"processing_time", stats.timeSpent},
                                                    {"disk_size", 1LL << 40},
                                                    {"free_space", 1LL << 33}}));
}

TEST_F(DiskSizeCalculatorTest, AnUnknownDiskIsReportedAsZeros) {
  calculator_.setAnalytics(true);
  files_->failAlways(Operation::GetDiskSpace, EIO);
  makeFile("root/file", 12);
  EXPECT_EQ(calculator_.calculateDirectorySize(directory_.file("root")).size, 12);
  ASSERT_EQ(events_->events().size(), 1U);
  EXPECT_EQ(events_->events()[0].json().at("disk_size"), 0);
  EXPECT_EQ(events_->events()[0].json().at("free_space"), 0);
  EXPECT_EQ(events_->events()[0].json().at("size"), 12);
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(DiskSizeCalculatorTest, AFileOfOneMebibyteIsReportedByItselfAndOneByteLessIsNot) {
  calculator_.setAnalytics(true);
  makeFile("root/below", 1048575);
  const string large = makeFile("root/exactly", 1048576);
  calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_THAT(reportedPaths(), ElementsAre(large, directory_.file("root")));
  const JsonValue event = events_->events()[0].json();
  EXPECT_EQ(event.at("size"), 1048576);
  EXPECT_EQ(event.at("file_count"), 1);
  EXPECT_EQ(event.at("processing_time").get<double>(), 0.0);
}

TEST_F(DiskSizeCalculatorTest, AnExcludedLargeFileIsNotReported) {
  calculator_.setAnalytics(true);
  makeFile("root/large", 2000000);
  calculator_.exclude("large");
  calculator_.calculateDirectorySize(directory_.file("root"));
  EXPECT_THAT(reportedPaths(), ElementsAre(directory_.file("root")));
}

TEST_F(DiskSizeCalculatorTest, WithoutAReporterMeasuringWorks) {
  DiskSizeCalculator calculator(files_, attributes_, nullptr);
  calculator.setAnalytics(true);
  makeFile("root/large", 2000000);
  EXPECT_EQ(calculator.calculateDirectorySize(directory_.file("root")).size, 2000000);
  EXPECT_EQ(files_->calls(Operation::GetDiskSpace), 0U);
}

// Registered directories

TEST_F(DiskSizeCalculatorTest, StartingMeasuresTheRegisteredDirectoriesAndForgetsThem) {
  makeFile("a/file", 1);
  makeFile("b/file", 2);
  makeFile("c/file", 3);
  calculator_.addDirectory(directory_.file("a"), 0);
  calculator_.addDirectory(directory_.file("b"), 0);
  calculator_.startDiskSizeCalculation();
  EXPECT_EQ(calculator_.fetchDirectorySize(directory_.file("a")), 1);
  EXPECT_EQ(calculator_.fetchDirectorySize(directory_.file("b")), 2);
  EXPECT_FALSE(hasResult("c"));
  keep("a", kWeek + 1, 0);
  files_->clearTrace();
  calculator_.startDiskSizeCalculation();
  EXPECT_THAT(files_->trace(), IsEmpty());
}

TEST_F(DiskSizeCalculatorTest, ADirectoryCanBeRegisteredAgainAfterAStart) {
  makeFile("a/file", 1);
  calculator_.addDirectory(directory_.file("a"), 10);
  calculator_.startDiskSizeCalculation();
  keep("a", 100, 999);
  calculator_.addDirectory(directory_.file("a"), 10);
  calculator_.startDiskSizeCalculation();
  EXPECT_NE(calculator_.fetchDirectorySize(directory_.file("a")), 999);
}

TEST_F(DiskSizeCalculatorTest, TheIntervalOfAForgottenDirectoryIsForgottenToo) {
  makeFile("a/file", 1);
  calculator_.addDirectory(directory_.file("a"), 10);
  calculator_.startDiskSizeCalculation();
  keep("a", 100, 999);
  EXPECT_TRUE(calculator_.calculateDirectorySize(directory_.file("a")).valid);
}

TEST_F(DiskSizeCalculatorTest, TheLastRegisteredIntervalCounts) {
  makeFile("a/file", 1);
  calculator_.addDirectory(directory_.file("a"), 10);
  calculator_.addDirectory(directory_.file("a"), 1000);
  keep("a", 100, 999);
  EXPECT_TRUE(calculator_.calculateDirectorySize(directory_.file("a")).valid);
}

TEST_F(DiskSizeCalculatorTest, WhatIsNoDirectoryIsNotRegistered) {
  calculator_.addDirectory(makeFile("file", 1), 10);
  calculator_.addDirectory(directory_.file("later"), 10);
  makeFile("later/file", 1);
  files_->clearTrace();
  calculator_.startDiskSizeCalculation();
  EXPECT_THAT(files_->trace(), IsEmpty());
}

TEST_F(DiskSizeCalculatorTest, OneDirectoryThatFailsOrVanishedDoesNotStopTheOthers) {
  makeFile("a/file", 1);
  makeFile("broken/file", 1);
  makeFile("vanished/file", 1);
  makeFile("z/file", 2);
  for (const char* name : {"a", "broken", "vanished", "z"}) calculator_.addDirectory(directory_.file(name), 10);
  files_->failPath(Operation::ListDirectory, directory_.file("broken"), EIO);
  std::filesystem::remove_all(directory_.file("vanished"));
  calculator_.startDiskSizeCalculation();
  EXPECT_TRUE(hasResult("a"));
  EXPECT_TRUE(hasResult("z"));
  EXPECT_FALSE(hasResult("broken"));
  EXPECT_EQ(log_.errorCount(), 1U);
}

TEST_F(DiskSizeCalculatorTest, StartingMeasuresThroughTheVirtualOperation) {
  class Counting : public DiskSizeCalculator {
   public:
    using DiskSizeCalculator::DiskSizeCalculator;
    Stats calculateDirectorySize(const string& path) override {
      asked.push_back(path);
      return {false, 0, 0, 0};
    }
    std::vector<string> asked;
  };
  Counting calculator(files_, attributes_, nullptr);
  calculator.addDirectory(directory_.makeDirectory("a"), 10);
  calculator.startDiskSizeCalculation();
  EXPECT_THAT(calculator.asked, ElementsAre(directory_.file("a")));
}

// Threads

TEST_F(DiskSizeCalculatorTest, WhatChangesDuringAMeasurementCountsFromTheNextOneAndNothingIsLocked) {
  makeTree();
  calculator_.exclude(kAttributesFile);
  files_->onCall = [&](Operation operation, const string& path) {
    if (operation != Operation::ListDirectory || path != directory_.file("root")) return;
    calculator_.exclude("sub");
    calculator_.addDirectory(directory_.file("root/sub"), 1);
    calculator_.setAnalytics(false);
  };
  EXPECT_EQ(calculator_.calculateDirectorySize(directory_.file("root")).size, 321);
  keep("root", kWeek + 1, 0);
  EXPECT_EQ(calculator_.calculateDirectorySize(directory_.file("root")).size, 21);
}

TEST_F(DiskSizeCalculatorTest, SettingsMayChangeOnOtherThreadsWhileATreeIsMeasured) {
  makeTree();
  calculator_.exclude(kAttributesFile);
  test::runOnThreads(3, [&](std::size_t thread) {
    for (int i = 0; i < 50; ++i) {
      if (thread == 0) {
        attributes_->remove(directory_.file("root"));
        if (calculator_.calculateDirectorySize(directory_.file("root")).size != 321)
          throw std::logic_error("wrong size");
      } else if (thread == 1) {
        calculator_.exclude("other " + std::to_string(i));
        calculator_.setAnalytics(i % 2 == 0);
      } else {
        calculator_.addDirectory(directory_.file("root/sub"), kWeek);
        calculator_.fetchDirectorySize(directory_.file("root/sub"));
      }
    }
  });
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
