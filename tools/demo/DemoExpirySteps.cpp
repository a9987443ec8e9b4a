#include <array>
#include <chrono>
#include <cstdint>
#include <ctime>
#include <map>
#include <string>
#include <vector>

#include "Console.h"
#include "Format.h"
#include "Stopwatch.h"
#include "demo/DemoContext.h"
#include "demo/DemoSteps.h"
#include "demo/ManifestFile.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr const char* kStore = "thumbnails";

constexpr long kDay = 86400;
constexpr std::chrono::seconds kFirstExpiry(300);  // after the start, and then every hour
constexpr std::chrono::seconds kExpiryInterval(3600);

// Days since the last use.
constexpr int kYoung = 0;
constexpr int kMiddleAged = 25;
constexpr int kOld = 31;
constexpr int kShorterStaleAge = 20;

constexpr std::size_t kPictureBytes = 4U << 10U;

using Ages = std::map<int, KeyValueClient::Items>;

// Makes a third of the values old and another third middle-aged, in the manifest of the stopped application.
Ages makeOlder(KeyValueClient::Items& items, const std::string& directory) {
  constexpr std::array ages = {kYoung, kMiddleAged, kOld};
  const std::int64_t now = std::time(nullptr);
  Ages byAge;
  std::map<std::string, std::int64_t> dates;
  std::size_t number = 0;
  for (auto& [key, item] : items) {
    const int days = ages[number++ % ages.size()];
    dates[key] = now - days * kDay;
    item.used = {dates[key], dates[key]};
    byAge[days].emplace(key, item);
  }
  ManifestFile(directory).setLastAccessDates(dates);
  return byAge;
}

std::string countOf(const Ages& byAge, int days) {
  const auto items = byAge.find(days);
  return formatCount(items == byAge.end() ? 0 : items->second.size());
}

std::string daysText(int days) { return std::to_string(days) + " days ago"; }

void checkExpired(DemoContext& context, const Ages& byAge, int days) {
  const auto gone = byAge.find(days);
  if (gone == byAge.end()) return;
  for (const auto& item : gone->second) context.values(kStore).items().erase(item.first);
  context.checkValues();
}

void letPass(DemoContext& context, std::chrono::seconds time) {
  context.checks.isTrue("what timers set off ends", context.app().letPass(time));
}

}  // namespace

void expireStale(DemoContext& context) {
  const auto definition = context.definition(kStore);
  const std::string directory = context.app().expectedDirectory(*definition);
  Ages byAge;
  context.restartAfter([&] {
    byAge = makeOlder(context.clientOf(kStore).items(), directory);
    context.console.line("of the " + std::string(kStore) + ", " + countOf(byAge, kOld) + " are dated as last used " +
                         daysText(kOld) + " and " + countOf(byAge, kMiddleAged) + " " + daysText(kMiddleAged) +
                         ", in the manifest, while the application is stopped");
  });
  context.checkValues();
  letPass(context, kFirstExpiry - std::chrono::seconds(1));
  context.checkValues();
  context.console.line("nothing expires at the start, nor within " + std::to_string(kFirstExpiry.count() - 1) +
                       " seconds of it (on a clock that the demo moves on)");

  letPass(context, std::chrono::seconds(1));
  checkExpired(context, byAge, kOld);
  context.console.line("a second later those of " + daysText(kOld) + " have gone: more than their stale age of " +
                       std::to_string(dynamic_cast<const DiskCacheDefinition&>(*definition).staleAge / kDay) + " days");

  context.app().keyValueStore(kStore)->overrideConfiguration(kShorterStaleAge * kDay);
  letPass(context, kExpiryInterval);
  checkExpired(context, byAge, kMiddleAged);
  context.console.line("with a stale age of " + std::to_string(kShorterStaleAge) + " days, an hour later those of " +
                       daysText(kMiddleAged) + " have gone, too; " + countOf(byAge, kYoung) + " are left");
  context.checkContents();
}

void clearStore(DemoContext& context) {
  KeyValueClient& client = context.values(kStore);
  const std::vector<std::string> keys = client.keys();
  const TreeSize before = client.size();
  const std::size_t missesBefore = client.misses();
  const Stopwatch watch;
  client.clear();
  context.console.line(formatFiles(before) + " of " + kStore + " cleared in " + formatTime(watch.elapsed()) +
                       "; every other store is as it was");
  context.checkContents();
  for (const std::string& key : keys) client.fetch(key);
  context.checkValues();
  context.checks.equal("misses after the clear", keys.size(), client.misses() - missesBefore);

  client.store("first-again", {0, kPictureBytes});
  client.fetch("first-again");
  context.checkValues();
}

}  // namespace velmora::mobile::xplat::cellar::tools
