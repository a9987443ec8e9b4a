#include <algorithm>
#include <cstdint>
#include <ctime>
#include <map>
#include <string>

#include "Console.h"
#include "Format.h"
#include "demo/DemoContext.h"
#include "demo/DemoSteps.h"
#include "demo/ManifestFile.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::uint64_t kDay = 86400;

using Rows = std::map<std::string, ManifestFile::Row>;

bool isAsStored(const std::string& key, const KeyValueClient::Item& item, const ManifestFile::Row& row,
                bool hasInlineData) {
  const auto size = static_cast<std::int64_t>(item.size);
  return row.filename == key && row.size == size && row.isInline == hasInlineData &&
         row.inlineBytes == (hasInlineData ? size : 0) && item.stored.includes(row.modificationDate) &&
         item.used.includes(row.lastAccessDate);
}

void checkRows(DemoContext& context, const std::string& store, const Rows& rows, bool hasInlineData) {
  const KeyValueClient::Items& items = context.clientOf(store).items();
  context.checks.equal("rows of " + store, items.size(), rows.size());
  std::size_t right = 0;
  for (const auto& [key, item] : items) {
    const auto row = rows.find(key);
    if (row != rows.end() && isAsStored(key, item, row->second, hasInlineData)) ++right;
  }
  context.checks.equal("rows of " + store + " with the right file, size and dates", items.size(), right);
}

// Gives each use a moment of its own in the past day: the later the use, the later the moment.
void spreadOverADay(KeyValueClient::Items& items, std::uint64_t uses, ManifestFile& manifest) {
  const std::int64_t now = std::time(nullptr);
  const std::uint64_t secondsPerUse = std::max<std::uint64_t>(1, kDay / std::max<std::uint64_t>(1, uses));
  std::map<std::string, std::int64_t> dates;
  for (auto& [key, item] : items) {
    const std::int64_t date = now - static_cast<std::int64_t>((uses + 1 - item.number) * secondsPerUse);
    item.used = {date, date};
    dates[key] = date;
  }
  manifest.setLastAccessDates(dates);
}

}  // namespace

void lookFromOutside(DemoContext& context) {
  const auto stores = context.managedStores();
  std::map<std::string, std::string> directories;
  for (const auto& store : stores) directories[store->name] = context.app().expectedDirectory(*store);
  context.restartAfter([&] {
    std::size_t count = 0;
    for (const auto& store : stores) {
      ManifestFile manifest(directories[store->name]);
      const Rows rows = manifest.rowsByKey();
      checkRows(context, store->name, rows, isInline(*store));
      count += rows.size();
      KeyValueClient& client = context.clientOf(store->name);
      spreadOverADay(client.items(), client.uses(), manifest);
    }
    context.console.line(formatCount(count, "row", "rows") + " in " +
                         formatCount(stores.size(), "manifest", "manifests") +
                         ", compared with the files, sizes and dates that the host has noted itself");
    context.console.line("the dates of last use, all within seconds, are spread over the past day, in the same order");
  });
  context.checkContents();
}

}  // namespace velmora::mobile::xplat::cellar::tools
