// The commands beside a real application, and an application after them.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include <cellar/PersistentKeyValueStore.h>
#include <cellar/host/Await.h>
#include <cellar/host/Host.h>

#include "inspect/Survey.h"
#include "storage/ConfiguredStores.h"
#include "storage/Layout.h"
#include "support/TemporaryDirectory.h"
#include "verify/Verification.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

const char* const kConfiguration = R"({ "user": { "area": "documents", "session_scoped": false, "max_size": "1MB",
  "prune_interval": "1 hours", "stores": { "drafts": { "type": "pkvs", "has_version": true } } } })";

class LookingAtAHost : public testing::Test {
 protected:
  using Store = PersistentKeyValueStore;

  // The store of an application that runs until `stop`.
  std::shared_ptr<Store> start() {
    host_ = std::make_unique<host::Host>(kConfiguration, directory_.path());
    return host_->store<Store>("drafts");
  }
  void stop() { host_.reset(); }

  void put(const std::string& key, const std::string& value) const {
    const auto store = host_->store<Store>("drafts");
    host::await(store->store(key, std::vector<unsigned char>(value.begin(), value.end())));
  }

  std::string get(const std::string& key) const {
    const auto found = host::await(host_->store<Store>("drafts")->fetch(key));
    return found == nullptr ? "<miss>" : std::string(found->value.begin(), found->value.end());
  }

  Survey inspect() const {
    return makeSurvey(findLayout(directory_.path()), ConfiguredStores(), 5, 0, [](std::uint64_t) {});
  }

  VerificationResult repair() const {
    return verify(
        findLayout(directory_.path()), true, [](std::uint64_t) {}, [](const std::string&) {});
  }

  // The one store there is.
  std::string storePath() const { return findLayout(directory_.path()).managers.at(0).stores.at(0).path; }

  test::TemporaryDirectory directory_;
  std::unique_ptr<host::Host> host_;
};

TEST_F(LookingAtAHost, SeesWhatARunningStoreHasWrittenAndLeavesItRunning) {
  start();
  put("a", "value");
  put("b", "another");
  const Survey survey = inspect();
  EXPECT_EQ(survey.managers.at(0).stores.at(0).items, 2U);
  EXPECT_EQ(survey.managers.at(0).stores.at(0).recordedBytes, 12U);
  put("c", "more");
  EXPECT_EQ(get("a") + get("b") + get("c"), "valueanothermore");
  EXPECT_EQ(inspect().managers.at(0).stores.at(0).items, 3U);
}

TEST_F(LookingAtAHost, LeavesAnApplicationItsValuesAfterARepair) {
  start();
  put("kept", "value");
  put("longer", "value");
  put("lost", "value");
  stop();
  std::ofstream(storePath() + "/longer", std::ios::app) << " and more";
  std::ofstream(storePath() + "/stray") << "stray";
  std::filesystem::remove(storePath() + "/lost");
  const VerificationResult result = repair();
  EXPECT_EQ(result.findings, 3U);
  EXPECT_EQ(result.repaired, 3U);
  EXPECT_EQ(repair().findings, 0U);
  const auto store = start();
  EXPECT_EQ(get("kept"), "value");
  EXPECT_EQ(get("longer"), "value and more");
  EXPECT_EQ(get("lost"), "<miss>");
  EXPECT_EQ(get("stray"), "<miss>");
}

TEST_F(LookingAtAHost, LetsAnApplicationBeginAnewAfterADamagedManifest) {
  start();
  put("a", "value");
  stop();
  std::ofstream(storePath() + "/manifest_v1.sqlite") << std::string(5000, 'x');
  EXPECT_EQ(repair().repaired, 1U);
  start();
  EXPECT_EQ(get("a"), "<miss>");
  put("a", "again");
  EXPECT_EQ(get("a"), "again");
  stop();
  EXPECT_EQ(repair().findings, 0U);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
