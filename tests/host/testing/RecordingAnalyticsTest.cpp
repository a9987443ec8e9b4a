#include <gtest/gtest.h>

#include <memory>

#include "AnalyticsEventReporter.h"
#include "host/testing/RecordingAnalytics.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

TEST(RecordingAnalytics, RemembersEventsInOrder) {
  const auto log = std::make_shared<EventLog>();
  RecordingAnalytics analytics(log);
  analytics.logEvent("name", "category", R"({"a":1})", "12");
  analytics.logEvent("other", "", "{}", "");
  ASSERT_EQ(log->events().size(), 2U);
  const LoggedEvent first = log->named("name").at(0);
  EXPECT_EQ(first.category, "category");
  EXPECT_EQ(first.json().at("a"), 1);
  EXPECT_EQ(first.time, "12");
  EXPECT_TRUE(log->named("unknown").empty());
  log->clear();
  EXPECT_TRUE(log->events().empty());
}

TEST(RecordingAnalytics, TheReporterOverItKeepsWritingIntoTheLog) {
  const auto log = std::make_shared<EventLog>();
  const auto reporter = recordingReporter(log);
  reporter->reportEvent(StoreManagerEvent(StoreManagerEvent::Type::Pruning, "store", 1, 2));
  EXPECT_EQ(log->events().size(), 1U);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
