#include "Incident.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "support/IncidentLog.h"
#include "support/LogCapture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;

class IncidentFixture : public testing::Test {
 protected:
  void report(const std::string& name) const {
    incidents_.reporter->report({Incident::Kind::DamagedValue, name, "key", "why"});
  }

  static std::string told(const std::string& name) { return "DamagedValue " + name + " of key: why"; }

  test::IncidentLog incidents_;
  test::LogCapture log_;
};

class IncidentReporterTest : public IncidentFixture {};
class IncidentDeferralTest : public IncidentFixture {};

TEST_F(IncidentReporterTest, HandsIncidentsOverOnItsQueueInTheirOrder) {
  report("a");
  report("b");
  EXPECT_EQ(incidents_.queue->pending(), 2U);
  EXPECT_THAT(incidents_.take(), ElementsAre(told("a"), told("b")));
  EXPECT_THAT(log_.messages(), IsEmpty());
}

TEST_F(IncidentReporterTest, AHandlerThatThrowsIsOneLineInTheLogAndHearsOfTheNextIncident) {
  incidents_.onIncident = [](const Incident& incident) {
    if (incident.name == "a") throw std::runtime_error("no");
    if (incident.name == "b") throw 1;  // NOLINT: a handler is free to
  };
  for (const char* name : {"a", "b", "c"}) report(name);
  EXPECT_THAT(incidents_.take(), ElementsAre(told("a"), told("b"), told("c")));
  EXPECT_THAT(log_.messages(), ElementsAre("The handler of an incident failed: no",
                                           "The handler of an incident failed: unknown exception"));
}

TEST_F(IncidentReporterTest, AHandlerThatThrowsWhereItIsReportedDoesNotReachTheReportingThread) {
  incidents_.runAtOnce();
  incidents_.onIncident = [](const Incident&) { throw std::runtime_error("no"); };
  report("a");
  EXPECT_THAT(log_.messages(), ElementsAre("The handler of an incident failed: no"));
}

TEST_F(IncidentReporterTest, AQueueThatRefusesIsOneLineInTheLogAndTheNextIncidentComes) {
  incidents_.queue->throwOnDispatch(true);
  report("a");
  ASSERT_EQ(log_.messages().size(), 1U);
  EXPECT_THAT(log_.messages()[0], testing::StartsWith("Could not report an incident: "));
  incidents_.queue->throwOnDispatch(false);
  report("b");
  EXPECT_THAT(incidents_.take(), ElementsAre(told("b")));
  EXPECT_EQ(log_.messages().size(), 1U);
}

TEST_F(IncidentReporterTest, WhatItHasReportedIsHandedOverWhenItIsGone) {
  std::vector<std::string> names;
  const auto queue = std::make_shared<test::ManualExecutor>();
  auto reporter =
      std::make_unique<IncidentReporter>(queue, [&names](const Incident& incident) { names.push_back(incident.name); });
  reporter->report({Incident::Kind::StorePurged, "a", "", ""});
  reporter.reset();
  queue->runAll();
  EXPECT_THAT(names, ElementsAre("a"));
}

TEST_F(IncidentDeferralTest, KeepsIncidentsUntilTheOutermostOneEnds) {
  incidents_.runAtOnce();
  {
    const IncidentDeferral outer;
    report("a");
    {
      const IncidentDeferral inner;
      report("b");
    }
    report("c");
    EXPECT_THAT(incidents_.take(), IsEmpty());
  }
  EXPECT_THAT(incidents_.take(), ElementsAre(told("a"), told("b"), told("c")));
  report("d");
  EXPECT_THAT(incidents_.take(), ElementsAre(told("d")));
}

TEST_F(IncidentDeferralTest, KeepsNothingOfOtherThreads) {
  const IncidentDeferral deferral;
  std::thread([this] { report("a"); }).join();
  EXPECT_THAT(incidents_.take(), ElementsAre(told("a")));
}

TEST_F(IncidentDeferralTest, ThatAnExceptionEndsHandsOverWhatItHas) {
  incidents_.runAtOnce();
  incidents_.onIncident = [](const Incident&) { throw std::runtime_error("another"); };
  const auto fail = [this] {
    const IncidentDeferral deferral;
    report("a");
    throw std::invalid_argument("one");
  };
  EXPECT_THROW(fail(), std::invalid_argument);
  EXPECT_THAT(incidents_.take(), ElementsAre(told("a")));
}

TEST_F(IncidentDeferralTest, AHandlerThatItCallsMayReport) {
  incidents_.runAtOnce();
  incidents_.onIncident = [this](const Incident& incident) {
    if (incident.name == "a") report("b");
  };
  {
    const IncidentDeferral deferral;
    report("a");
  }
  EXPECT_THAT(incidents_.take(), ElementsAre(told("a"), told("b")));
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
