#include <algorithm>
#include <cstdint>
#include <iterator>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "Console.h"
#include "Format.h"
#include "PruneStrategy.h"
#include "demo/DateRange.h"
#include "demo/DemoContext.h"
#include "demo/DemoSteps.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::size_t kPictureBytes = 256U << 10U;
constexpr std::size_t kSettingBytes = 100;

// Chunks up to this second of a video count as if they had been used an hour later than they were.
constexpr int kBeginningSeconds = 10;
constexpr int kGrace = 3600;

using Item = KeyValueClient::Item;

DateRange lastUse(const Item& item) { return item.used; }

bool isBeginning(const Item& item) { return item.value.chunkSecond && *item.value.chunkSecond <= kBeginningSeconds; }

DateRange lastUseOrGrace(const Item& item) { return isBeginning(item) ? item.used.plus(kGrace) : item.used; }

// What a store has lost, in the order in which the files were deleted.
struct Losses {
  std::vector<Item> items;
  std::size_t unknown = 0;  // files that the host knows nothing of
};

std::string newKey(std::size_t number) { return "new-" + std::to_string(number); }

KeyValueClient::Value newPicture(const DemoContext& context, std::size_t number) {
  return {number % context.source.files.size(), kPictureBytes, std::nullopt};
}

// Lets thumbnails come in until they are over their own limit, at least one so that the manager learns their size.
void bringThumbnails(DemoContext& context) {
  const std::uint64_t limit = context.definition("thumbnails")->maxSize;
  KeyValueClient& thumbnails = context.values("thumbnails");
  std::size_t number = 0;
  do {
    thumbnails.store(newKey(number), newPicture(context, number));
    ++number;
  } while (thumbnails.size().bytes <= limit);
  thumbnails.finish();
  context.noteSizes();
  context.checks.equal("prunes while the manager is within its limit", 0, context.storeEvents("pruning").size());
  context.console.line("thumbnails: " + formatSize(thumbnails.size().bytes) + ", more than their limit of " +
                       formatSize(limit) + "; the manager is within its own, so they stay");
}

// Lets the chunks of a video come in until the manager is over its limit, and no further.
std::size_t bringVideo(DemoContext& context, std::uint64_t limit) {
  const std::uint64_t others = context.values("thumbnails").size().bytes;
  KeyValueClient& videos = context.values("videos");
  std::size_t second = 0;
  while (others + videos.size().bytes <= limit) {
    KeyValueClient::Value chunk = newPicture(context, second);
    chunk.chunkSecond = static_cast<int>(second);
    videos.store(newKey(second), chunk);
    ++second;
  }
  videos.finish();
  return second;
}

Losses takeOutLosses(DemoContext& context, const std::string& store) {
  KeyValueClient::Items& items = context.values(store).items();
  const std::string directory = context.app().expectedDirectory(*context.definition(store)) + "/";
  Losses losses;
  for (const std::string& path : context.app().files().deletions()) {
    if (path.rfind(directory, 0) != 0) continue;
    const auto lost = items.extract(path.substr(directory.size()));
    if (lost.empty()) {
      ++losses.unknown;
    } else {
      losses.items.push_back(lost.mapped());
    }
  }
  return losses;
}

std::vector<DateRange> ranksOf(const std::vector<Item>& items, DateRange (*rank)(const Item&)) {
  std::vector<DateRange> ranks;
  std::transform(items.begin(), items.end(), std::back_inserter(ranks), rank);
  return ranks;
}

std::vector<Item> itemsIn(const KeyValueClient::Items& items) {
  std::vector<Item> values;
  for (const auto& item : items) values.push_back(item.second);
  return values;
}

// "5 of 20", how many of the beginnings of videos, or of the others.
std::string shareOf(bool beginnings, const std::vector<Item>& gone, const std::vector<Item>& left) {
  const auto counts = [&](const Item& item) { return isBeginning(item) == beginnings; };
  const auto went = static_cast<std::uint64_t>(std::count_if(gone.begin(), gone.end(), counts));
  const auto stayed = static_cast<std::uint64_t>(std::count_if(left.begin(), left.end(), counts));
  return formatCount(went) + " of " + formatCount(went + stayed);
}

// "1.2 MB below"
std::string distanceFrom(std::uint64_t limit, std::uint64_t bytes) {
  return bytes > limit ? formatSize(bytes - limit) + " over" : formatSize(limit - bytes) + " below";
}

void sayWhatWent(DemoContext& context, const std::string& store, const std::vector<Item>& gone) {
  const TreeSize left = context.values(store).size();
  context.console.line(store + ": " + formatCount(gone.size()) + " of " + formatCount(gone.size() + left.files) +
                       " went; left are " + formatFiles(left) + ", " +
                       distanceFrom(context.definition(store)->maxSize, left.bytes) + " their limit");
}

// Works out from its own notes in which order the values had to go, and how many of them.
Losses checkPruned(DemoContext& context, const std::string& store, DateRange (*rank)(const Item&)) {
  Losses losses = takeOutLosses(context, store);
  const std::vector<DateRange> gone = ranksOf(losses.items, rank);
  const std::vector<DateRange> left = ranksOf(itemsIn(context.values(store).items()), rank);
  const std::uint64_t limit = context.definition(store)->maxSize;
  const std::uint64_t bytes = context.values(store).size().bytes;
  context.checks.equal("unknown files deleted from " + store, 0, losses.unknown);
  context.checks.isTrue("values of " + store + " went in their order", canBeInOrder(gone));
  context.checks.isTrue("what is left of " + store + " comes after what went", canBeBefore(gone, left));
  context.checks.isTrue(store + " are within their limit", bytes <= limit);
  context.checks.isTrue("no more of " + store + " went than had to",
                        !losses.items.empty() && bytes + losses.items.back().size > limit);
  sayWhatWent(context, store, losses.items);
  return losses;
}

// A store at its capacity takes a new value in for the one used least recently.
void bringSetting(DemoContext& context) {
  const auto capacity = dynamic_cast<const PKVSDefinition&>(*context.definition("settings")).capacity;
  KeyValueClient& settings = context.values("settings");
  if (!capacity || settings.items().size() < static_cast<std::size_t>(*capacity)) return;
  const auto isOlder = [](const auto& a, const auto& b) { return a.second.used.latest < b.second.used.latest; };
  const auto oldest = std::min_element(settings.items().begin(), settings.items().end(), isOlder);
  context.console.line("settings: a new one comes in, and " + oldest->first + ", used least recently of the " +
                       formatCount(static_cast<std::uint64_t>(*capacity)) + " that there may be, has to go");
  settings.items().erase(oldest);
  settings.store(newKey(0), {0, kSettingBytes});
  context.checkValues();
}

void checkReports(DemoContext& context, const std::map<std::string, std::uint64_t>& sizesBefore) {
  const std::vector<JsonValue> reports = context.storeEvents("pruning");
  context.checks.equal("prunes reported", sizesBefore.size(), reports.size());
  for (const JsonValue& report : reports) {
    const auto store = report.at("store_name").get<std::string>();
    context.checks.equal("size reported of " + store, sizesBefore.at(store),
                         report.at("current_size").get<std::uint64_t>());
    context.checks.equal("limit reported of " + store, context.definition(store)->maxSize,
                         report.at("max_size").get<std::uint64_t>());
  }
}

}  // namespace

void pruneCaches(DemoContext& context) {
  VideoDownloadPruneStrategy::priorityWeight = kGrace;
  VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = kBeginningSeconds;
  const auto manager = context.app().host().configuration()->getManager("player");
  bringThumbnails(context);
  const std::size_t chunks = bringVideo(context, manager->maxSize);
  context.checks.isTrue("the pruning ends", context.app().settle());
  context.noteSizes();

  const std::uint64_t thumbnails = context.values("thumbnails").size().bytes;
  const std::uint64_t videos = context.values("videos").size().bytes;
  context.console.line("a video of " + formatCount(chunks) + " chunks comes in, and with " +
                       formatSize(thumbnails + videos) + " the manager is over its limit of " +
                       formatSize(manager->maxSize) + ":");
  checkPruned(context, "thumbnails", lastUse);
  context.console.line("  least recently used first, file by file in the order of the host's own notes");
  const Losses losses = checkPruned(context, "videos", lastUseOrGrace);
  const std::vector<Item> leftVideos = itemsIn(context.values("videos").items());
  context.console.line("  the same with an hour's grace for the first " + std::to_string(kBeginningSeconds) +
                       " seconds of a video: " + shareOf(true, losses.items, leftVideos) + " of those went, and " +
                       shareOf(false, losses.items, leftVideos) + " others");
  const std::uint64_t left = context.values("thumbnails").size().bytes + context.values("videos").size().bytes;
  context.console.line("the manager is now " + distanceFrom(manager->maxSize, left) + " its limit");
  bringSetting(context);
  checkReports(context, {{"thumbnails", thumbnails}, {"videos", videos}});
  context.checkContents();
}

}  // namespace velmora::mobile::xplat::cellar::tools
