#include "inspect/Growth.h"

#include <algorithm>
#include <array>
#include <ctime>
#include <limits>

#include "Console.h"
#include "Format.h"
#include "InputError.h"
#include "JsonPlace.h"
#include "Table.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

using Align = Table::Align;

// So much smaller than what can be counted that sums and differences can be counted, too. A sparse file may claim more.
constexpr std::uint64_t kMost = std::uint64_t{1} << 53U;

PartFigures figuresIn(const JsonPlace& part, const char* items, const char* held) {
  const auto countOf = [&](const char* name) {
    return std::min(kMost, part.at(name).count(0, std::numeric_limits<std::int64_t>::max()));
  };
  return {countOf(items), countOf(held), countOf("allocated_bytes")};
}

bool isSame(const PartFigures& a, const PartFigures& b) {
  return a.items == b.items && a.heldBytes == b.heldBytes && a.allocatedBytes == b.allocatedBytes;
}

std::uint64_t extent(const Change& change) {
  const std::uint64_t before = change.before.value_or(PartFigures()).allocatedBytes;
  const std::uint64_t after = change.after.value_or(PartFigures()).allocatedBytes;
  return std::max(before, after) - std::min(before, after);
}

void add(const PartFigures& part, PartFigures& sum) {
  sum.items += part.items;
  sum.heldBytes += part.heldBytes;
  sum.allocatedBytes += part.allocatedBytes;
}

nlohmann::ordered_json asJson(const std::optional<PartFigures>& figures) {
  if (!figures) return nullptr;
  return {{"items", figures->items}, {"held_bytes", figures->heldBytes}, {"allocated_bytes", figures->allocatedBytes}};
}

std::string dateText(std::int64_t date) {
  const auto time = static_cast<std::time_t>(date);
  std::tm parts{};
  std::array<char, 64> text{};
  (void)gmtime_r(&time, &parts);
  (void)std::strftime(text.data(), text.size(), "%Y-%m-%d %H:%M:%S UTC", &parts);
  return text.data();
}

template <class Format> std::string changeText(std::uint64_t before, std::uint64_t after, Format format) {
  if (before == after) return "0";
  return after > before ? "+" + format(after - before) : "-" + format(before - after);
}

void addRow(const std::string& title, const PartFigures& before, const PartFigures& after, const std::string& note,
            Table& table) {
  const auto count = [](std::uint64_t number) { return formatCount(number); };
  table.addRow(
      {title, changeText(before.items, after.items, count), changeText(before.heldBytes, after.heldBytes, formatSize),
       changeText(before.allocatedBytes, after.allocatedBytes, formatSize), formatSize(after.allocatedBytes), note});
}

}  // namespace

Moment momentOf(const nlohmann::json& document, const std::string& file) {
  const JsonPlace root(file, document);
  Moment moment;
  moment.date = static_cast<std::int64_t>(root.at("inspected_at").count(0, kMost));
  moment.depth = root.at("depth").text();
  const JsonPlace managers = root.at("managers");
  for (std::size_t i = 0; i < managers.size(); ++i) {
    const JsonPlace stores = managers.at(i).at("stores");
    for (std::size_t j = 0; j < stores.size(); ++j) {
      const JsonPlace store = stores.at(j);
      moment.parts[store.at("path").text()] = figuresIn(store, "items", "held_bytes");
    }
  }
  const JsonPlace leftovers = root.at("leftovers");
  for (std::size_t i = 0; i < leftovers.size(); ++i) {
    const JsonPlace leftover = leftovers.at(i);
    moment.parts.emplace(leftover.at("path").text(), figuresIn(leftover, "files", "bytes"));  // unless it is a store's
  }
  return moment;
}

Growth growthBetween(const Moment& before, const Moment& after) {
  const bool isComparable = before.depth == after.depth || before.depth == "empty" || after.depth == "empty";
  if (!isComparable) {
    throw InputError("cannot compare what is in a directory of the kind '" + after.depth +
                     "' with what was in one of the kind '" + before.depth + "'");
  }
  Growth growth{before.date, after.date, {}};
  for (const auto& [path, figures] : before.parts) {
    const auto found = after.parts.find(path);
    if (found == after.parts.end()) {
      growth.changes.push_back({path, figures, std::nullopt});
    } else if (!isSame(figures, found->second)) {
      growth.changes.push_back({path, figures, found->second});
    }
  }
  for (const auto& [path, figures] : after.parts) {
    if (before.parts.count(path) == 0) growth.changes.push_back({path, std::nullopt, figures});
  }
  std::stable_sort(growth.changes.begin(), growth.changes.end(),
                   [](const Change& a, const Change& b) { return extent(a) > extent(b); });
  return growth;
}

nlohmann::ordered_json growthAsJson(const Growth& growth) {
  nlohmann::ordered_json json;
  json["since"] = growth.since;
  json["parts"] = nlohmann::ordered_json::array();
  for (const Change& change : growth.changes) {
    json["parts"].push_back(
        {{"path", change.path}, {"before", asJson(change.before)}, {"after", asJson(change.after)}});
  }
  return json;
}

void printGrowth(const Growth& growth, Console& console) {
  console.heading("Since " + dateText(growth.since));
  if (growth.changes.empty()) return console.line("nothing has changed");
  Table table({{"Store or directory", Align::Left},
               {"Items", Align::Right},
               {"Held", Align::Right},
               {"On disk", Align::Right},
               {"Now on disk", Align::Right},
               {"", Align::Left}});
  PartFigures before;
  PartFigures after;
  for (const Change& change : growth.changes) {
    const char* const note = !change.before ? "new" : !change.after ? "gone" : "";
    const PartFigures earlier = change.before.value_or(PartFigures());
    const PartFigures later = change.after.value_or(PartFigures());
    add(earlier, before);
    add(later, after);
    addRow(change.path, earlier, later, note, table);
  }
  if (growth.changes.size() > 1) addRow("all together", before, after, "", table);
  console.raw(table.text());
}

}  // namespace velmora::mobile::xplat::cellar::tools
