#include "AnalyticsEventReporter.h"

#include <gtest/gtest.h>

#include <chrono>
#include <climits>
#include <ctime>
#include <memory>
#include <stdexcept>
#include <string>
#include <type_traits>
#include <utility>

#include "host/testing/RecordingAnalytics.h"
#include "support/Barrier.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using test::EventLog;
using test::LoggedEvent;
using Hit = PersistentKeyValueStoreEvent::Hit;

class ThrowingAnalytics : public XAnalytics {
 public:
  void logEvent(const string&, const string&, const string&, const string&) override {
    throw std::domain_error("sink is full");
  }
};

class CountingItsDestruction : public XAnalytics {
 public:
  explicit CountingItsDestruction(int& destroyed) : destroyed_(destroyed) {}
  CountingItsDestruction(const CountingItsDestruction&) = delete;
  CountingItsDestruction& operator=(const CountingItsDestruction&) = delete;
  ~CountingItsDestruction() override { ++destroyed_; }
  void logEvent(const string&, const string&, const string&, const string&) override {}

 private:
  int& destroyed_;
};

class AnalyticsEventReporterTest : public testing::Test {
 protected:
  // The one event that a report leads to.
  template <class Event> LoggedEvent reported(const Event& event) {
    log_->clear();
    reporter_->reportEvent(event);
    const std::vector<LoggedEvent> events = log_->events();
    if (events.size() != 1) throw std::runtime_error("expected one event, got " + std::to_string(events.size()));
    return events.front();
  }

  template <class Event> JsonValue payload(const Event& event) { return reported(event).json(); }

  std::shared_ptr<EventLog> log_ = std::make_shared<EventLog>();
  std::shared_ptr<AnalyticsEventReporter> reporter_ = test::recordingReporter(log_);
};

StoreManagerEvent pruning(const string& storeName) { return {StoreManagerEvent::Type::Pruning, storeName, 1, 2}; }

TEST_F(AnalyticsEventReporterTest, AStoreManagerEventHasExactlyItsFourKeys) {
  EXPECT_EQ(payload(StoreManagerEvent(StoreManagerEvent::Type::Eviction, "thumbs", 12, 34)),
            (JsonValue{{"event_type", "eviction"}, {"store_name", "thumbs"}, {"current_size", 12}, {"max_size", 34}}));
}

TEST_F(AnalyticsEventReporterTest, EachStoreManagerEventTypeHasItsText) {
  using Type = StoreManagerEvent::Type;
  EXPECT_EQ(payload(StoreManagerEvent(Type::Eviction, "", 0, 0)).at("event_type"), "eviction");
  EXPECT_EQ(payload(StoreManagerEvent(Type::Initialization, "", 0, 0)).at("event_type"), "initialization");
  EXPECT_EQ(payload(StoreManagerEvent(Type::Pruning, "", 0, 0)).at("event_type"), "pruning");
}

TEST_F(AnalyticsEventReporterTest, TheNumbersOfTheEnumerationsAreFixed) {
  EXPECT_EQ(static_cast<int>(StoreManagerEvent::Type::Eviction), 0);
  EXPECT_EQ(static_cast<int>(StoreManagerEvent::Type::Initialization), 1);
  EXPECT_EQ(static_cast<int>(StoreManagerEvent::Type::Pruning), 2);
  EXPECT_EQ(static_cast<int>(Hit::Found), 0);
  EXPECT_EQ(static_cast<int>(Hit::Missing), 1);
}

TEST_F(AnalyticsEventReporterTest, AnUnknownStoreManagerEventTypeThrowsAndReportsNothing) {
  for (const int number : {-1, 3, INT_MAX}) {
    const StoreManagerEvent event(static_cast<StoreManagerEvent::Type>(number), "store", 1, 2);
    try {
      reporter_->reportEvent(event);
      ADD_FAILURE() << "no exception for " << number;
    } catch (const std::invalid_argument& exception) {
      EXPECT_STREQ(exception.what(), "Bad Enum Value");
    }
  }
  EXPECT_TRUE(log_->events().empty());
}

TEST_F(AnalyticsEventReporterTest, StoreSizesUpToTheLargest32BitNumberAreReportedExactly) {
  const JsonValue json = payload(StoreManagerEvent(StoreManagerEvent::Type::Pruning, "s", 4294967295U, 2147483648U));
  EXPECT_EQ(json.at("current_size").get<long long>(), 4294967295LL);
  EXPECT_EQ(json.at("max_size").get<long long>(), 2147483648LL);
  EXPECT_TRUE(json.at("current_size").is_number_integer());
}

TEST_F(AnalyticsEventReporterTest, AnAccessHasExactlyItsSixKeys) {
  EXPECT_EQ(
      payload(PersistentKeyValueStoreEvent(Hit::Found, "store", "key", "tag", true, 7, 99)),
      (JsonValue{{"store_name", "store"}, {"key", "key"}, {"tag", "tag"}, {"hit", 0}, {"itemAge", 7}, {"size", 99}}));
}

TEST_F(AnalyticsEventReporterTest, AnAccessWithoutATagReportsTheEmptyTextAndKeepsTheKey) {
  const JsonValue json = payload(PersistentKeyValueStoreEvent(Hit::Found, "s", "k", "not meant", false, 0, 0));
  ASSERT_TRUE(json.contains("tag"));
  EXPECT_EQ(json.at("tag"), "");
}

TEST_F(AnalyticsEventReporterTest, AMissingKeyReportsHitOneWithoutAgeAndSize) {
  const JsonValue json = payload(PersistentKeyValueStoreEventBuilder(Hit::Missing, "s", "k").get());
  EXPECT_EQ(json.at("hit"), 1);
  EXPECT_TRUE(json.at("hit").is_number_integer());
  EXPECT_EQ(json.at("itemAge"), 0);
  EXPECT_EQ(json.at("size"), 0);
}

TEST_F(AnalyticsEventReporterTest, ANegativeAgeKeepsItsSign) {
  EXPECT_EQ(payload(PersistentKeyValueStoreEvent(Hit::Found, "s", "k", "", false, -5, 0)).at("itemAge"), -5);
}

TEST_F(AnalyticsEventReporterTest, AMeasurementHasExactlyItsSixKeys) {
  EXPECT_EQ(payload(DiskSizeCalculatorEvent("/a/b", 10, 3, 0.25, 1000, 500)), (JsonValue{{"directory_path", "/a/b"},
                                                                                         {"size", 10},
                                                                                         {"file_count", 3},
                                                                                         {"processing_time", 0.25},
                                                                                         {"disk_size", 1000},
                                                                                         {"free_space", 500}}));
}

TEST_F(AnalyticsEventReporterTest, MeasuredSizesBeyond32BitsAreReportedExactly) {
  const JsonValue json = payload(DiskSizeCalculatorEvent("/", 2147483649LL, 4294967297LL, 0, LLONG_MAX, LLONG_MIN));
  EXPECT_EQ(json.at("size").get<long long>(), 2147483649LL);
  EXPECT_EQ(json.at("file_count").get<long long>(), 4294967297LL);
  EXPECT_EQ(json.at("disk_size").get<long long>(), LLONG_MAX);
  EXPECT_EQ(json.at("free_space").get<long long>(), LLONG_MIN);
  for (const char* key : {"size", "file_count", "disk_size", "free_space"}) {
    EXPECT_TRUE(json.at(key).is_number_integer()) << key;
  }
}

TEST_F(AnalyticsEventReporterTest, TimesStayFloatingPointNumbersEvenWhenWhole) {
  EXPECT_TRUE(payload(DiskSizeCalculatorEvent("/", 0, 0, 2.0, 0, 0)).at("processing_time").is_number_float());
  EXPECT_TRUE(payload(TrashCollectorEvent(std::chrono::milliseconds(2000), 0)).at("time_spent").is_number_float());
}

TEST_F(AnalyticsEventReporterTest, AnEmptyingHasExactlyItsTwoKeysAndItsTimeInSeconds) {
  EXPECT_EQ(payload(TrashCollectorEvent(std::chrono::milliseconds(1500), 4)),
            (JsonValue{{"time_spent", 1.5}, {"file_count", 4}}));
  EXPECT_EQ(payload(TrashCollectorEvent(std::chrono::milliseconds(1), 0)).at("time_spent").get<double>(), 0.001);
}

TEST_F(AnalyticsEventReporterTest, TheLargestFileCountIsReportedExactly) {
  const JsonValue count = payload(TrashCollectorEvent(std::chrono::milliseconds(0), ULLONG_MAX)).at("file_count");
  EXPECT_EQ(count.get<unsigned long long>(), ULLONG_MAX);
  EXPECT_TRUE(count.is_number_integer());
}

TEST_F(AnalyticsEventReporterTest, EachKindOfEventHasItsNameAndAllShareOneCategory) {
  const LoggedEvent manager = reported(pruning("s"));
  const LoggedEvent access = reported(PersistentKeyValueStoreEvent(Hit::Found, "s", "k", "", false, 0, 0));
  const LoggedEvent measurement = reported(DiskSizeCalculatorEvent("/", 0, 0, 0, 0, 0));
  const LoggedEvent emptying = reported(TrashCollectorEvent(std::chrono::milliseconds(0), 0));
  EXPECT_EQ(manager.name, "qzdiskstore_logging");
  EXPECT_EQ(access.name, "qzpkvs_access");
  EXPECT_EQ(measurement.name, "qzdisk_size_calculator_logging");
  EXPECT_EQ(emptying.name, "qztrash_collector");
  for (const LoggedEvent& event : {manager, access, measurement, emptying}) EXPECT_EQ(event.category, "perf");
}

TEST_F(AnalyticsEventReporterTest, ThePayloadIsCompactText) {
  const LoggedEvent event = reported(TrashCollectorEvent(std::chrono::milliseconds(1500), 4));
  EXPECT_TRUE(event.payload == R"({"file_count":4,"time_spent":1.5})" ||
              event.payload == R"({"time_spent":1.5,"file_count":4})")
      << event.payload;
}

TEST_F(AnalyticsEventReporterTest, TheTimeIsTheClockInWholeSeconds) {
  const std::time_t before = std::time(nullptr);
  const LoggedEvent event = reported(pruning("s"));
  const std::time_t after = std::time(nullptr);
  EXPECT_EQ(event.time.find_first_not_of("0123456789"), string::npos) << event.time;
  EXPECT_GE(std::stoll(event.time), before);
  EXPECT_LE(std::stoll(event.time), after);
}

TEST_F(AnalyticsEventReporterTest, TextThatIsNotUtf8IsReplacedAndNeverThrows) {
  const string damaged =
      "a\xff\xfe"
      "b";
  for (const JsonValue& json : {payload(pruning(damaged)), payload(DiskSizeCalculatorEvent(damaged, 0, 0, 0, 0, 0)),
                                payload(PersistentKeyValueStoreEvent(Hit::Found, damaged, "k", "", false, 0, 0))}) {
    const string text = json.contains("store_name") ? json.at("store_name") : json.at("directory_path");
    EXPECT_EQ(text,
              "a\xEF\xBF\xBD\xEF\xBF\xBD"
              "b");
  }
  const JsonValue access = payload(PersistentKeyValueStoreEvent(Hit::Found, "s", damaged, damaged, true, 0, 0));
  EXPECT_EQ(access.at("key"), access.at("tag"));
}

TEST_F(AnalyticsEventReporterTest, ATextCutInsideACharacterOrHoldingAZeroByteIsReported) {
  EXPECT_EQ(payload(pruning("caf\xC3")).at("store_name"), "caf\xEF\xBF\xBD");
  const string withZero("a\0b", 3);
  EXPECT_EQ(payload(pruning(withZero)).at("store_name").get<string>(), withZero);
  EXPECT_EQ(payload(pruning("\"quoted\"\n")).at("store_name"), "\"quoted\"\n");
}

TEST_F(AnalyticsEventReporterTest, WhatTheSinkThrowsReachesTheReportingComponent) {
  const AnalyticsEventReporter reporter(std::make_unique<ThrowingAnalytics>());
  EXPECT_THROW(reporter.reportEvent(pruning("s")), std::domain_error);
  EXPECT_THROW(reporter.reportEvent(PersistentKeyValueStoreEvent(Hit::Found, "", "", "", false, 0, 0)),
               std::domain_error);
  EXPECT_THROW(reporter.reportEvent(DiskSizeCalculatorEvent("", 0, 0, 0, 0, 0)), std::domain_error);
  EXPECT_THROW(reporter.reportEvent(TrashCollectorEvent(std::chrono::milliseconds(0), 0)), std::domain_error);
}

TEST_F(AnalyticsEventReporterTest, SeveralThreadsMayReportAtOnce) {
  test::runOnThreads(4, [&](std::size_t thread) {
    for (int i = 0; i < 50; ++i) reporter_->reportEvent(pruning("store " + std::to_string(thread)));
  });
  EXPECT_EQ(log_->named("qzdiskstore_logging").size(), 200U);
}

TEST(AnalyticsEventReporter, DestroysItsSinkWithItself) {
  int destroyed = 0;
  auto reporter = std::make_unique<AnalyticsEventReporter>(std::make_unique<CountingItsDestruction>(destroyed));
  EXPECT_EQ(destroyed, 0);
  reporter.reset();
  EXPECT_EQ(destroyed, 1);
}

TEST(AnalyticsEventReporter, ASubclassReceivesTheReportsInstead) {
  class Substitute : public AnalyticsEventReporter {
   public:
    explicit Substitute(std::unique_ptr<XAnalytics> sink) : AnalyticsEventReporter(std::move(sink)) {}
    using AnalyticsEventReporter::reportEvent;
    void reportEvent(const TrashCollectorEvent& event) const override { seen = event.fileCount; }
    mutable unsigned long long seen = 0;
  };
  const auto log = std::make_shared<EventLog>();
  const Substitute substitute(std::make_unique<test::RecordingAnalytics>(log));
  const AnalyticsEventReporter& reporter = substitute;
  reporter.reportEvent(TrashCollectorEvent(std::chrono::milliseconds(0), 12));
  EXPECT_EQ(substitute.seen, 12U);
  EXPECT_TRUE(log->events().empty());
}

TEST(PersistentKeyValueStoreEventBuilder, StartsWithoutTagAgeAndSize) {
  const PersistentKeyValueStoreEventBuilder builder(Hit::Found, "store", "key");
  const PersistentKeyValueStoreEvent& event = builder.get();
  EXPECT_EQ(event.hit, Hit::Found);
  EXPECT_EQ(event.storeName, "store");
  EXPECT_EQ(event.key, "key");
  EXPECT_EQ(event.tag, "");
  EXPECT_FALSE(event.hasTag);
  EXPECT_EQ(event.age, 0);
  EXPECT_EQ(event.size, 0U);
}

TEST(PersistentKeyValueStoreEventBuilder, ChainsItsSteps) {
  PersistentKeyValueStoreEventBuilder builder(Hit::Found, "store", "key");
  const PersistentKeyValueStoreEvent& event = builder.tag("tag").age(-3).size(4294967295U).get();
  EXPECT_EQ(&event, &builder.get());
  EXPECT_EQ(event.tag, "tag");
  EXPECT_TRUE(event.hasTag);
  EXPECT_EQ(event.age, -3);
  EXPECT_EQ(event.size, 4294967295U);
}

TEST(PersistentKeyValueStoreEventBuilder, AnEmptyTagIsStillATag) {
  PersistentKeyValueStoreEventBuilder builder(Hit::Found, "store", "key");
  EXPECT_TRUE(builder.tag("").get().hasTag);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
