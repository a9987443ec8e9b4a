#include "inspect/Watch.h"

#include <algorithm>
#include <array>
#include <ctime>
#include <iterator>

#include "Console.h"
#include "Format.h"
#include "Table.h"
#include "inspect/SurveyWords.h"
#include "inspect/Totals.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

using Align = Table::Align;

std::string timeText(std::int64_t date) {
  const auto time = static_cast<std::time_t>(date);
  std::tm parts{};
  std::array<char, 16> text{};
  (void)localtime_r(&time, &parts);
  (void)std::strftime(text.data(), text.size(), "%H:%M:%S", &parts);
  return text.data();
}

// How many of the one are not among the other; both ascending.
std::uint64_t countWithout(const std::vector<std::uint64_t>& some, const std::vector<std::uint64_t>& others) {
  std::vector<std::uint64_t> rest;
  std::set_difference(some.begin(), some.end(), others.begin(), others.end(), std::back_inserter(rest));
  return rest.size();
}

}  // namespace

void Watch::show(const Survey& survey) {
  console_.startAgain();
  const Totals totals = totalsOf(survey);
  console_.heading(timeText(survey.inspectedAt) + "  " + formatCount(totals.items, "item", "items") + ", " +
                   formatSize(totals.allocatedBytes) + " on the disk, " + formatSize(totals.leftoverAllocatedBytes) +
                   " left over");
  for (const ManagerSurvey& manager : survey.managers) showManager(manager);
  if (!survey.unreadable.empty()) {
    console_.bad(formatCount(survey.unreadable.size(), "part", "parts") + " not readable, or gone meanwhile");
  }
  isFirst_ = false;
}

void Watch::showManager(const ManagerSurvey& manager) {
  console_.heading(titleOf(manager));
  Table table({{"Store", Align::Left},
               {"Items", Align::Right},
               {"Came", Align::Right},
               {"Gone", Align::Right},
               {"Held", Align::Right},
               {"On disk", Align::Right},
               {"Limit", Align::Right},
               {"Full", Align::Right}});
  for (const StoreSurvey& store : manager.stores) {
    const Tally& tally = tallyOf(store);
    table.addRow({store.name, formatCount(store.items), formatCount(tally.came), formatCount(tally.gone),
                  formatSize(store.heldBytes()), formatSize(store.allocatedBytes), limitText(store),
                  percentText(fillOf(store))});
  }
  console_.raw(table.text());
  for (const StoreSurvey& store : manager.stores) {
    if (store.damages.empty()) continue;
    console_.bad(store.name + ": the manifest is damaged, or was written to while it was read");
  }
}

const Watch::Tally& Watch::tallyOf(const StoreSurvey& store) {
  const bool isNew = tallies_.count(store.path) == 0 && !isFirst_;
  Tally& tally = tallies_[store.path];
  if (store.isUnread || !store.damages.empty()) return tally;  // its files are not called as its items are
  if (isNew) tally.keys.emplace();
  if (tally.keys) {
    tally.came += countWithout(store.keyHashes, *tally.keys);
    tally.gone += countWithout(*tally.keys, store.keyHashes);
  }
  tally.keys = store.keyHashes;
  return tally;
}

}  // namespace velmora::mobile::xplat::cellar::tools
