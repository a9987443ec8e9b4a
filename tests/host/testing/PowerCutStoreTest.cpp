#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/testing/ManualQueue.h>
#include <cellar/host/testing/PowerCut.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
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
  Drafts(const string& directory, const std::shared_ptr<FileUtils>& files, bool isInline) {
    StoreServices services;
    services.queues = queues_;
    services.files = files;
    services.trash = std::make_shared<TrashCollector>(directory + "/trash", files, nullptr, queues_);
    KeyValueStoreOptions options;
    options.directory = directory + "/drafts";
    options.temporaryDirectory = directory + "/tmp";
    options.name = "drafts";
    options.inlineData = isInline;
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

class PowerCutStore : public testing::TestWithParam<bool> {
 protected:
  void live(const std::shared_ptr<FileUtils>& files) const {
    Drafts drafts(life_.path(), files, GetParam());
    for (int version = 0; version < kVersions; ++version) {
      for (int key = 0; key < kKeys; ++key) drafts.store(keyOf(key), valueOf(key, version));
      if (version == 3) drafts.remove(keyOf(0));
    }
  }

  // What is left has to be usable, and an inline value is one that was stored.
  void inspect(const string& directory) {
    Drafts drafts(directory, std::make_shared<FileUtils>(), GetParam());
    for (int key = 0; key < kKeys; ++key) {
      const auto value = drafts.fetch(keyOf(key));
      if (!value) continue;
      ++found_;
      if (!isValueOf(*value, key)) ++torn_;
    }
    drafts.store("new", "value");
    EXPECT_EQ(drafts.fetch("new"), "value");
  }

  const LogCapture logs_;
  TemporaryDirectory life_;
  int found_ = 0;
  int torn_ = 0;
};

TEST_P(PowerCutStore, IsUsableWhateverIsLeftOfIt) {
  PowerCut powerCut(life_.path());
  std::uint32_t operations = 0;
  powerCut.onOperation([&] {
    if (++operations % 5 != 0) return;
    const TemporaryDirectory left;
    powerCut.cutInto(left.path(), operations);
    inspect(left.path());
  });
  live(powerCut.files());
  powerCut.onOperation(nullptr);
  EXPECT_GT(operations, 200U);
  EXPECT_GT(found_, 0);
  if (GetParam()) {
    EXPECT_EQ(torn_, 0);
  } else {
    EXPECT_GT(torn_, 0);  // such values are written in place, and not synced
  }
}

INSTANTIATE_TEST_SUITE_P(Of, PowerCutStore, testing::Values(false, true),
                         [](const auto& parameter) { return parameter.param ? "InlineValues" : "Files"; });

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
