#include <algorithm>
#include <chrono>
#include <cstdint>
#include <ctime>
#include <fstream>
#include <iterator>
#include <string>
#include <thread>
#include <vector>

#include "Console.h"
#include "DemoContext.h"
#include "DemoSteps.h"
#include "DiskCache.h"
#include "ExtendedMetadata.h"
#include "Format.h"
#include "PersistentKeyValueStore.h"
#include "PruneStrategy.h"
#include "Stopwatch.h"
#include "host/Await.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

using Bytes = std::vector<unsigned char>;

constexpr std::size_t kDrafts = 25;
constexpr std::size_t kLongestDraft = 4096;
constexpr std::size_t kSettings = 25;  // more than their capacity
constexpr std::size_t kPictureBytes = 32U << 10U;
constexpr std::size_t kPictures = 96;  // 3 MB of thumbnails
constexpr std::size_t kFavourites = 10;

std::string draftKey(std::size_t number) { return "draft-" + std::to_string(number); }
std::string pictureKey(std::size_t number) { return "picture-" + std::to_string(number); }
std::string chunkKey(std::size_t second) { return "sunrise-" + std::to_string(second); }

// The beginning of one of the source files, so that reading it back can be compared.
Bytes draft(const DemoContext& context, std::size_t number) {
  const SourceFiles::File& file = context.source.files[number % context.source.files.size()];
  std::string text(std::min<std::uint64_t>(file.size, kLongestDraft), '\0');
  std::ifstream in(file.path, std::ios::binary);
  in.read(text.data(), static_cast<std::streamsize>(text.size()));
  return Bytes(text.begin(), text.begin() + in.gcount());
}

Bytes picture(std::size_t number) { return Bytes(kPictureBytes, static_cast<unsigned char>(number)); }

bool holds(PersistentKeyValueStore& store, const std::string& key) { return host::await(store.fetch(key)) != nullptr; }

bool holds(PersistentKeyValueStore& store, const std::string& key, const Bytes& value) {
  const auto found = host::await(store.fetch(key));
  return found != nullptr && found->value == value;
}

// Dates of access are whole seconds of this clock, which may lag behind finer ones: what is used in the next second has
// been used later.
void letASecondBegin() {
  const std::time_t now = std::time(nullptr);
  while (std::time(nullptr) == now) std::this_thread::sleep_for(std::chrono::milliseconds(1));
}

std::string directoryOf(DemoContext& context, const std::string& store) {
  return context.app().expectedDirectory(*context.app().host().configuration()->getStore(store));
}

void checkPruned(DemoContext& context, const std::string& store, std::size_t itemsBefore) {
  const std::uint64_t limit = context.app().host().configuration()->getStore(store)->maxSize;
  const TreeSize left = sizeOfValues(directoryOf(context, store));
  context.checks.isTrue(store + " are pruned", left.files < itemsBefore);
  context.checks.isTrue(store + " are within their limit", left.bytes <= limit);
  context.checks.equal("values of " + store, limit / kPictureBytes, left.files);
  context.checkKeys(store, left.files);
  context.console.line(store + ": " + formatCount(itemsBefore) + " values of " + formatSize(kPictureBytes) + ", " +
                       formatCount(left.files) + " of them left, " + formatSize(left.bytes) + " of at most " +
                       formatSize(limit));
}

// Until the manager is over its limit, and no further. Returns how many there are.
std::size_t storeVideo(DemoContext& context, std::uint64_t bytesAlreadyThere) {
  const auto videos = context.app().host().store<DiskCache>("videos");
  const std::uint64_t limit = context.app().host().configuration()->getManager("player")->maxSize;
  std::size_t second = 0;
  for (std::uint64_t total = bytesAlreadyThere; total <= limit; total += kPictureBytes) {
    const auto metadata = std::make_shared<VideoDownloadExtendedMetadata>(
        static_cast<int>(second), VideoDownloadExtendedMetadata::ItemType::VideoChunk);
    host::await(videos->store(chunkKey(second), picture(second), metadata));
    ++second;
  }
  return second;
}

}  // namespace

void storeByKey(DemoContext& context) {
  const auto drafts = context.app().keyValueStore("drafts");
  const auto settings = context.app().keyValueStore("settings");
  const Stopwatch watch;
  for (std::size_t i = 0; i < kDrafts; ++i) host::await(drafts->store(draftKey(i), draft(context, i)));
  for (std::size_t i = 0; i < kSettings; ++i) host::await(settings->store("setting-" + std::to_string(i), {'o', 'n'}));
  context.app().settle();
  context.console.line(formatCount(kDrafts) + " drafts and " + formatCount(kSettings) + " settings stored in " +
                       formatTime(watch.elapsed()));

  host::await(drafts->removeItem(draftKey(0)));
  context.checks.isTrue("a removed draft is a miss", !holds(*drafts, draftKey(0)));
  context.checks.isTrue("another draft is a hit", holds(*drafts, draftKey(1), draft(context, 1)));
  context.checkKeys("drafts", kDrafts - 1);
  context.checks.equal("files of drafts", kDrafts - 1, sizeOfValues(directoryOf(context, "drafts")).files);

  const auto capacity = settings->getAllKeys().size();
  context.console.line("of the settings the " + formatCount(capacity) +
                       " are left that there may be; they have no files of their own");
  context.checkKeys("settings", 20);
  context.checks.isTrue("the last setting is a hit", holds(*settings, "setting-" + std::to_string(kSettings - 1)));
  context.checks.equal("files of settings", 0, sizeOfValues(directoryOf(context, "settings")).files);
}

void pruneCaches(DemoContext& context) {
  const auto thumbnails = context.app().host().store<DiskCache>("thumbnails");
  for (std::size_t i = 0; i < kPictures; ++i) host::await(thumbnails->store(pictureKey(i), picture(i)));
  context.app().settle();
  context.console.line(formatSize(kPictures * kPictureBytes) +
                       " of thumbnails: more than their limit, but the manager "
                       "is within its own, so they stay");
  context.checks.equal("thumbnails before", kPictures, sizeOfValues(directoryOf(context, "thumbnails")).files);

  letASecondBegin();
  for (std::size_t i = 0; i < kFavourites; ++i) host::await(thumbnails->fetch(pictureKey(i)));
  const std::size_t chunks = storeVideo(context, kPictures * kPictureBytes);
  context.checks.isTrue("the pruning ends", context.app().settle());
  context.console.line("a video comes in, and the manager is over its limit:");
  checkPruned(context, "thumbnails", kPictures);
  checkPruned(context, "videos", chunks);
  context.checks.equal("prunes reported", 2, context.storeEvents("pruning").size());

  for (std::size_t i = 0; i < kFavourites; ++i) {
    context.checks.isTrue(pictureKey(i) + ", just looked at, is kept", holds(*thumbnails, pictureKey(i), picture(i)));
  }
  const auto videos = context.app().keyValueStore("videos");
  for (int i = 0; i <= VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff; ++i) {
    const auto second = static_cast<std::size_t>(i);
    context.checks.isTrue(chunkKey(second) + ", a beginning, is kept", holds(*videos, chunkKey(second)));
  }
  context.console.line("what was looked at last is among them, and so is the beginning of the video");
}

void findAgain(DemoContext& context) {
  const auto drafts = context.app().keyValueStore("drafts");
  const auto thumbnails = context.app().keyValueStore("thumbnails");
  const Stopwatch watch;
  for (std::size_t i = 1; i < kDrafts; ++i) {
    context.checks.isTrue(draftKey(i) + " is found again", holds(*drafts, draftKey(i), draft(context, i)));
  }
  for (std::size_t i = 0; i < kFavourites; ++i) {
    context.checks.isTrue(pictureKey(i) + " is found again", holds(*thumbnails, pictureKey(i), picture(i)));
  }
  context.console.line(formatCount(kDrafts - 1 + kFavourites) + " values read back in " + formatTime(watch.elapsed()));
  context.checks.isTrue("the removed draft is still a miss", !holds(*drafts, draftKey(0)));
  context.checkKeys("settings", 20);
}

}  // namespace velmora::mobile::xplat::cellar::tools
