// What a store wrote on one kind of machine, a phone's 32-bit or 64-bit ARM for instance, is read on every other.
//
// tests/files/KIND/ is what such a machine has written: with CELLAR_WRITE_FILES=DIRECTORY this program writes it anew.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string>
#include <utility>

#include "AttributeStore.h"
#include "DiskCache.h"
#include "DiskCacheManifest.h"
#include "ExtendedMetadata.h"
#include "FileUtils.h"
#include "StoreOptions.h"
#include "TrashCollector.h"
#include "host/Await.h"
#include "host/testing/ManualClock.h"
#include "host/testing/ManualQueue.h"
#include "support/Bytes.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar {
namespace {

namespace fs = std::filesystem;

using test::bytesOf;
using test::textOf;

constexpr std::int64_t kWritten = 1'700'000'000;
constexpr std::int64_t kUsed = kWritten + 1000;
const char* const kDurabilities[] = {"relaxed", "safe"};

const std::string kClip = "clip";
const std::string kFileValue(600, 'v');

// Reads and writes the stores "relaxed" and "safe", and attributes, below a directory.
class Files {
 public:
  explicit Files(const std::string& directory) : directory_(directory) {}

  void write() {
    for (const std::string durability : kDurabilities) {
      for (const bool isInline : {true, false}) {
        const auto cache = open(durability, isInline);
        const auto metadata =
            std::make_shared<VideoDownloadExtendedMetadata>(77, VideoDownloadExtendedMetadata::ItemType::VideoChunk);
        finish(cache->store(kClip, bytesOf("inline or not"), metadata));
        finish(cache->store("large", bytesOf(kFileValue)));
        finish(cache->store("empty", {}));
        clock_.advance(kUsed - kWritten);
        (void)finish(cache->fetch("large"));
        queues_->runAll();
        clock_.advance(kWritten - kUsed);
      }
      AttributeStore(files_).set(directory_ + "/" + durability + "-inline",
                                 {{"size", 4'294'967'296}, {"text", "\xc3\xa9"}});
    }
  }

  void expectWhatWasWritten() {
    for (const std::string durability : kDurabilities) {
      for (const bool isInline : {true, false}) {
        SCOPED_TRACE(durability + (isInline ? "-inline" : "-files"));
        expectStore(*open(durability, isInline));
        queues_->runAll();
      }
      EXPECT_EQ(AttributeStore(files_).get(directory_ + "/" + durability + "-inline"),
                JsonValue({{"size", 4'294'967'296}, {"text", "\xc3\xa9"}}));
    }
  }

 private:
  void expectStore(DiskCache& cache) {
    const auto manifest = cache.getManifest();
    ASSERT_EQ(manifest->count(), 3U);
    const auto date = [&](const std::string& key) { return manifest->getModificationDate(key).value_or(0); };
    EXPECT_EQ(date(kClip), kWritten);
    EXPECT_EQ(manifest->size(), std::string("inline or not").size() + kFileValue.size());
    const auto item = manifest->getItem(kClip);
    ASSERT_TRUE(item);
    const auto* const metadata = dynamic_cast<const VideoDownloadExtendedMetadata*>(item->extendedMetadata.get());
    ASSERT_NE(metadata, nullptr);
    EXPECT_EQ(metadata->getExtendedMetadata(), 77);
    EXPECT_EQ(metadata->getItemType(), VideoDownloadExtendedMetadata::ItemType::VideoChunk);
    EXPECT_EQ(manifest->getItem("large")->lastAccessDate, kUsed);
    EXPECT_EQ(valueOf(cache, kClip), "inline or not");
    EXPECT_EQ(valueOf(cache, "large"), kFileValue);
    EXPECT_EQ(valueOf(cache, "empty"), "");
  }

  std::string valueOf(DiskCache& cache, const std::string& key) {
    const auto found = finish(cache.fetch(key));
    return found == nullptr ? "<miss>" : textOf(found->value);
  }

  std::shared_ptr<DiskCache> open(const std::string& durability, bool isInline) {
    DiskCacheOptions options;
    options.directory = directory_ + "/" + durability + (isInline ? "-inline" : "-files");
    options.temporaryDirectory = temporary_.file("temporary");
    options.name = "sample";
    options.inlineData = isInline;
    options.normalSize = 1'000'000;
    options.extendedMetadataFactory = std::make_shared<VideoDownloadExtendedMetadataFactory>();
    options.durability = durability == "safe" ? Durability::Safe : Durability::Relaxed;
    const auto trash = std::make_shared<TrashCollector>(temporary_.file("trash"), files_, nullptr, queues_);
    auto cache = DiskCache::create(options, {queues_, trash, files_, nullptr});
    queues_->runAll();
    return cache;
  }

  template <class T> T finish(Future<T> future) {
    queues_->runAll();
    return host::await(std::move(future));
  }

  const std::string directory_;
  test::ManualClock clock_{kWritten};
  const test::TemporaryDirectory temporary_;
  const std::shared_ptr<FileUtils> files_ = std::make_shared<FileUtils>();
  const std::shared_ptr<test::ManualQueueFactory> queues_ = std::make_shared<test::ManualQueueFactory>();
};

// Reading changes dates of use, so a copy is read.
void expectWhatWasWrittenIn(const std::string& directory) {
  const test::TemporaryDirectory copy;
  fs::copy(directory, copy.path(), fs::copy_options::recursive);
  Files(copy.path()).expectWhatWasWritten();
}

TEST(OtherMachinesFiles, AreAsThisOneWritesThem) {
  const test::TemporaryDirectory own;
  const char* const asked = std::getenv("CELLAR_WRITE_FILES");
  const std::string directory = asked != nullptr ? asked : own.path();
  Files(directory).write();
  expectWhatWasWrittenIn(directory);
}

class OtherMachinesFilesOf : public testing::TestWithParam<std::string> {};

TEST_P(OtherMachinesFilesOf, AreRead) {
  expectWhatWasWrittenIn(std::string(CELLAR_SOURCE_DIR) + "/tests/files/" + GetParam());
}

INSTANTIATE_TEST_SUITE_P(Machines, OtherMachinesFilesOf, testing::Values("armv7", "arm64"));

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
