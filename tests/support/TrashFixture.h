#pragma once

#include <gtest/gtest.h>

#include <cstdint>
#include <filesystem>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "TrashCollector.h"
#include "host/testing/FaultyFileUtils.h"
#include "host/testing/ManualQueue.h"
#include "host/testing/RecordingAnalytics.h"
#include "support/LogCapture.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::test {

inline std::string ioFailure(int code, const std::string& text) {
  return "domain: QZLarderIoErrorErrorDomain; code: " + std::to_string(code) + "; description: " + text + " .";
}

// A collector over the trash directory `cache/trash` of the test's own, on a manual queue.
class TrashFixture : public testing::Test {
 protected:
  std::shared_ptr<TrashCollector> makeCollector(const std::shared_ptr<FileUtils>& files) {
    return std::make_shared<TrashCollector>(trashPath(), files, recordingReporter(events_), queues_);
  }

  std::shared_ptr<TrashCollector> makeCollectorWithoutQueue() {
    return std::make_shared<TrashCollector>(trashPath(), files_, recordingReporter(events_), nullptr);
  }

  std::string trashPath() const { return directory_.file("cache/trash"); }

  // The names in the trash; none when there is no trash directory.
  std::vector<std::string> trashed() const {
    return directory_.exists("cache/trash") ? directory_.names("cache/trash") : std::vector<std::string>();
  }

  // A directory that holds two files.
  std::string makeTree(const std::string& name) const {
    directory_.write(name + "/one", "1");
    directory_.write(name + "/two", "2");
    return directory_.file(name);
  }

  std::string link(const std::string& name, const std::string& target) const {
    std::filesystem::create_directories(std::filesystem::path(directory_.file(name)).parent_path());
    std::filesystem::create_symlink(target, directory_.file(name));
    return directory_.file(name);
  }

  // Empties the trash while the collector's queue runs what it is given, as a queue with a thread of its own would.
  void empty() {
    const auto queue = queues_->queue(0);
    queue->onDispatch = [raw = queue.get()] { raw->runAll(); };
    collector_->emptyAllTrash();
    queue->onDispatch = nullptr;
  }

  JsonValue onlyEvent() const {
    const std::vector<LoggedEvent> all = events_->events();
    if (all.size() != 1) throw std::runtime_error("expected one event, got " + std::to_string(all.size()));
    EXPECT_EQ(all[0].name, "qztrash_collector");
    return all[0].json();
  }

  std::uint64_t reportedCount() const { return onlyEvent().at("file_count").get<std::uint64_t>(); }

  TemporaryDirectory directory_;
  std::shared_ptr<FaultyFileUtils> files_ = std::make_shared<FaultyFileUtils>();
  std::shared_ptr<EventLog> events_ = std::make_shared<EventLog>();
  std::shared_ptr<ManualQueueFactory> queues_ = std::make_shared<ManualQueueFactory>();
  std::shared_ptr<TrashCollector> collector_ = makeCollector(files_);
  LogCapture log_;
};

}  // namespace velmora::mobile::xplat::cellar::test
