#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/testing/ManualQueue.h>
#include <cellar/host/testing/PowerCut.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <map>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <tuple>
#include <utility>

#include "support/Bytes.h"
#include "support/LogCapture.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

using std::string;

// A store over a file layer, whose queues run with each call.
class Drafts {
 public:
  Drafts(const string& directory, const std::shared_ptr<FileUtils>& files, bool isInline, Durability durability) {
    StoreServices services;
    services.queues = queues_;
    services.files = files;
    services.trash = std::make_shared<TrashCollector>(directory + "/trash", files, nullptr, queues_);
    KeyValueStoreOptions options;
    options.directory = directory + "/drafts";
    options.temporaryDirectory = directory + "/tmp";
    options.name = "drafts";
    options.inlineData = isInline;
    options.durability = durability;
    store_ = PersistentKeyValueStore::create(options, services);
    queues_->runAll();
  }

  void store(const string& key, const string& text) {
    Future<void> stored = store_->store(key, bytesOf(text));
    queues_->runAll();
    host::await(std::move(stored));
  }

  void remove(const string& key) {
    Future<void> removed = store_->removeItem(key);
    queues_->runAll();
    host::await(std::move(removed));
  }

  // Nothing for a miss, and for a value that cannot be read.
  std::optional<string> fetch(const string& key) {
    auto fetched = store_->fetch(key);
    queues_->runAll();
    try {
      const auto value = host::await(std::move(fetched));
      return value ? std::make_optional(textOf(value->value)) : std::nullopt;
    } catch (const LarderException&) {
      return std::nullopt;
    }
  }

 private:
  const std::shared_ptr<ManualQueueFactory> queues_ = std::make_shared<ManualQueueFactory>();
  std::shared_ptr<PersistentKeyValueStore> store_;
};

constexpr int kKeys = 4;
constexpr int kVersions = 6;

string keyOf(int number) { return "key" + std::to_string(number); }

string valueOf(int number, int version) {
  return string(static_cast<std::size_t>(1000 * version + 1), static_cast<char>('a' + number));
}

bool isValueOf(const string& text, int number) {
  bool isOne = false;
  for (int version = 0; version < kVersions; ++version) isOne = isOne || text == valueOf(number, version);
  return isOne;
}

// How often the power is cut, at the least. CELLAR_POWER_CUTS sets it for long runs.
std::uint32_t leastCuts() {
  const char* const number = std::getenv("CELLAR_POWER_CUTS");
  return number == nullptr ? 60 : static_cast<std::uint32_t>(std::stoul(number));
}

class PowerCutStore : public testing::TestWithParam<std::tuple<Durability, bool>> {
 protected:
  Durability durability() const { return std::get<0>(GetParam()); }
  bool isInline() const { return std::get<1>(GetParam()); }

  void live(const std::shared_ptr<FileUtils>& files) {
    Drafts drafts(life_.path(), files, isInline(), durability());
    for (int version = 0; version < kVersions; ++version) {
      for (int key = 0; key < kKeys; ++key) {
        underWay_ = {key, valueOf(key, version)};
        drafts.store(keyOf(key), valueOf(key, version));
        acknowledged_[key] = valueOf(key, version);
      }
      if (version == 3) {
        underWay_ = {0, std::nullopt};
        drafts.remove(keyOf(0));
        acknowledged_[0] = std::nullopt;
      }
      underWay_.first = -1;
    }
  }

  // What is left has to be usable, and is counted.
  void inspect(const string& directory) {
    ++cuts_;
    Drafts drafts(directory, std::make_shared<FileUtils>(), isInline(), durability());
    for (int key = 0; key < kKeys; ++key) {
      const auto value = drafts.fetch(keyOf(key));
      const bool isAsItWas = value == acknowledged_[key] || (underWay_.first == key && value == underWay_.second);
      if (!isAsItWas) ++lost_;
      if (!value) continue;
      ++found_;
      if (!isValueOf(*value, key)) ++torn_;
    }
    drafts.store("new", "value");
    EXPECT_EQ(drafts.fetch("new"), "value");
  }

  const LogCapture logs_;
  TemporaryDirectory life_;
  std::map<int, std::optional<string>> acknowledged_;
  std::pair<int, std::optional<string>> underWay_{-1, std::nullopt};
  std::uint32_t cuts_ = 0;
  int found_ = 0;
  int torn_ = 0;
  int lost_ = 0;
};

TEST_P(PowerCutStore, IsUsableWhateverIsLeftOfIt) {
  std::uint32_t operations = 0;
  while (cuts_ < leastCuts() && !HasFailure()) {
    std::filesystem::remove_all(life_.path());
    std::filesystem::create_directories(life_.path());
    acknowledged_.clear();
    PowerCut powerCut(life_.path());
    powerCut.onOperation([&] {
      if (++operations % 5 != 0) return;
      const TemporaryDirectory left;
      powerCut.cutInto(left.path(), operations);
      inspect(left.path());
    });
    live(powerCut.files());
    powerCut.onOperation(nullptr);
  }
  std::cout << cuts_ << " cuts: " << found_ << " values found, " << torn_ << " torn, " << lost_
            << " not as they were acknowledged\n";
  EXPECT_GT(found_, 0);
  if (durability() == Durability::Relaxed && !isInline()) {
    EXPECT_GT(torn_, 0);  // such values are written in place, and not synced
  } else {
    EXPECT_EQ(torn_, 0);
  }
  if (durability() == Durability::Synced) {
    EXPECT_EQ(lost_, 0);
  } else {
    EXPECT_GT(lost_, 0);  // the latest ones
  }
}

string nameOf(Durability durability) {
  return durability == Durability::Relaxed ? "Relaxed" : durability == Durability::Safe ? "Safe" : "Synced";
}

INSTANTIATE_TEST_SUITE_P(Of, PowerCutStore,
                         testing::Combine(testing::Values(Durability::Relaxed, Durability::Safe, Durability::Synced),
                                          testing::Bool()),
                         [](const auto& parameter) {
                           return nameOf(std::get<0>(parameter.param)) +
                                  (std::get<1>(parameter.param) ? "InlineValues" : "Files");
                         });

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
