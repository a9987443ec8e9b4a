#include "inspect/SurveyText.h"

#include <array>
#include <cstdint>
#include <optional>
#include <string>

#include "Console.h"
#include "Format.h"
#include "Printable.h"
#include "Table.h"
#include "inspect/SurveyWords.h"
#include "inspect/Totals.h"
#include "storage/FileSystemSize.h"
#include "storage/ReadableNames.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

using Align = Table::Align;

std::string sizeOrNothing(const std::optional<std::uint64_t>& bytes) { return bytes ? formatSize(*bytes) : "-"; }

// "3 days": the largest unit alone.
std::string formatAge(std::int64_t seconds) {
  struct Unit {
    std::int64_t seconds;
    const char* singular;
    const char* plural;
  };
  constexpr std::array<Unit, 4> units = {{{std::int64_t{365} * 86400, "year", "years"},
                                          {86400, "day", "days"},
                                          {3600, "hour", "hours"},
                                          {60, "minute", "minutes"}}};
  for (const Unit& unit : units) {
    if (seconds < unit.seconds) continue;
    return formatCount(static_cast<std::uint64_t>(seconds / unit.seconds), unit.singular, unit.plural);
  }
  return seconds < 0 ? "in the future" : "now";
}

std::string kindOf(const StoreSurvey& store) {
  switch (store.kind) {
    case StoreKind::DiskCache:
      return "disk cache";
    case StoreKind::KeyValue:
      return "key-value";
    case StoreKind::Keyed:
      return "with keys";
    case StoreKind::Unmanaged:
      break;
  }
  return "unmanaged";
}

std::string kindOf(LeftoverKind kind) {
  switch (kind) {
    case LeftoverKind::OtherVersion:
      return "another version";
    case LeftoverKind::OtherSession:
      return "another session";
    case LeftoverKind::NotConfigured:
      return "not configured";
    case LeftoverKind::Temporary:
      return "temporary files";
    case LeftoverKind::Trash:
      return "trash";
    case LeftoverKind::Quarantine:
      break;
  }
  return "quarantine";
}

class Printer {
 public:
  Printer(const Survey& survey, Console& console) : survey_(survey), console_(console) {}

  void print() {
    if (survey_.depth == "empty") {
      console_.raw("Nothing is stored in " + printable(survey_.root) + ": the directory is empty\n");
      return;
    }
    console_.raw("Storage in " + printable(survey_.root) + "\n");
    const auto size = survey_.fileSystemBytes;
    if (size && isTooSmall(*size)) console_.bad(tooSmallText(*size) + " (if this is the device)");
    for (const ManagerSurvey& manager : survey_.managers) printManager(manager);
    printLeftovers();
    printTotals();
    printUnreadable();
  }

 private:
  std::string age(const std::optional<std::int64_t>& date) const {
    return date ? formatAge(survey_.inspectedAt - *date) : "-";
  }

  void printManager(const ManagerSurvey& manager) {
    console_.heading(titleOf(manager));
    if (manager.stores.empty()) return console_.line("no stores");
    Table table({{"Store", Align::Left},
                 {"Kind", Align::Left},
                 {"Items", Align::Right},
                 {"Recorded", Align::Right},
                 {"Held", Align::Right},
                 {"On disk", Align::Right},
                 {"Limit", Align::Right},
                 {"Full", Align::Right},
                 {"Oldest use", Align::Right},
                 {"Last use", Align::Right},
                 {"Stale", Align::Right},
                 {"Durability", Align::Left}});
    for (const StoreSurvey& store : manager.stores) {
      table.addRow({printable(store.name), kindOf(store), formatCount(store.items), sizeOrNothing(store.recordedBytes),
                    formatSize(store.heldBytes()), formatSize(store.allocatedBytes), limitText(store),
                    percentText(fillOf(store)), age(store.oldestAccess), age(store.newestAccess),
                    store.staleItems ? formatCount(*store.staleItems) : "-",
                    store.durability.empty() ? "-" : store.durability});
    }
    console_.raw(table.text());
    for (const StoreSurvey& store : manager.stores) printItems(store);
  }

  void printItems(const StoreSurvey& store) {
    for (const std::string& damage : store.damages) {
      console_.bad(printable(store.name) + ": the manifest is damaged: " + printable(damage));
    }
    if (store.quarantinedFiles > 0) {
      console_.bad(printable(store.name) + ": " + formatCount(store.quarantinedFiles, "file", "files") + " (" +
                   formatSize(store.quarantinedBytes) + ") in quarantine, which the store could not use");
    }
    if (store.largest.empty()) return;
    console_.raw("\n");
    printList(printable(store.name) + ", largest", store.largest);
    if (store.nextToGo.empty()) return;
    std::string title = printable(store.name) + ", next to be evicted" + noteOfOrder(store);
    if (store.itemsToPrune.value_or(0) > 0) {
      title += " (a prune would remove " + formatCount(*store.itemsToPrune, "item", "items") + ", " +
               formatSize(*store.bytesToPrune) + ")";
    }
    printList(title, store.nextToGo);
  }

  static std::string noteOfOrder(const StoreSurvey& store) {
    if (!store.isOrderConfigured) return " by lru, as no configuration says otherwise";
    if (store.order == "greedy_dual") return " by greedy_dual, as after a restart";
    return store.order == "lru" ? "" : " by " + store.order + ", without the application's weights";
  }

  void printList(const std::string& title, const std::vector<ItemFigures>& items) {
    console_.line(title + ":");
    for (const ItemFigures& item : items) {
      const std::string used = formatAge(survey_.inspectedAt - item.lastAccess);
      const std::string decoded = decodedName(item.key);
      const std::string note = decoded.empty() ? "" : " ('" + decoded + "')";
      console_.line("  " + formatSize(item.bytes) + "  " + item.key + note + "  ",
                    used + (item.isInline ? ", inline" : "") + (item.reason.empty() ? "" : "; " + item.reason));
    }
  }

  void printLeftovers() {
    if (survey_.leftovers.empty()) return;
    console_.heading("Left over");
    Table table({{"Directory", Align::Left},
                 {"What", Align::Left},
                 {"Files", Align::Right},
                 {"Bytes", Align::Right},
                 {"On disk", Align::Right}});
    for (const Leftover& leftover : survey_.leftovers) {
      table.addRow({printable(leftover.path + sessionNote(leftover.path)), kindOf(leftover.kind),
                    formatCount(leftover.files), formatSize(leftover.bytes), formatSize(leftover.allocatedBytes)});
    }
    console_.raw(table.text());
  }

  void printTotals() {
    const Totals totals = totalsOf(survey_);
    console_.heading("All together");
    console_.line(formatCount(totals.stores, "store", "stores") + ", " + formatCount(totals.items, "item", "items") +
                  ", " + formatSize(totals.heldBytes) + " of values, " + formatSize(totals.manifestBytes) +
                  " of manifests, " + formatSize(totals.allocatedBytes) + " on the disk");
    if (survey_.leftovers.empty()) return;
    console_.line(formatSize(totals.leftoverAllocatedBytes) + " on the disk left over");
  }

  void printUnreadable() {
    if (survey_.unreadable.empty()) return;
    console_.heading("Not readable, and in none of the figures");
    for (const Unreadable& part : survey_.unreadable) {
      console_.bad(printable(part.path) + ": " + printable(part.reason));
    }
  }

  const Survey& survey_;
  Console& console_;
};

}  // namespace

void printSurvey(const Survey& survey, Console& console) { Printer(survey, console).print(); }

}  // namespace velmora::mobile::xplat::cellar::tools
