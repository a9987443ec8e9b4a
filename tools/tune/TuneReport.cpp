#include "tune/TuneReport.h"

#include <array>
#include <cstdio>
#include <limits>
#include <vector>

#include "Console.h"
#include "Format.h"
#include "Printable.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

using Json = nlohmann::ordered_json;

std::string percent(double part) {
  std::array<char, 32> text{};
  (void)std::snprintf(text.data(), text.size(), "%.2f %%", part * 100);
  return text.data();
}

std::string bytes(std::int64_t size) { return formatSize(static_cast<std::uint64_t>(size)); }

std::string wholeBytes(std::int64_t size) { return formatWholeSize(static_cast<std::uint64_t>(size)); }

std::string noteOn(const TunedLimit& limit) {
  if (limit.isPresent && limit.isEnough) return "present, and enough";
  if (limit.isPresent) return "present";
  return limit.isEnough ? "enough" : "";
}

// As a configuration names it, but for the one that no application can have.
std::string titleOf(const std::string& strategy) {
  return strategy == strategies::kForesight ? "with foresight" : strategy;
}

std::vector<Table::Column> columnsOf(const Tuning& tuning) {
  std::vector<Table::Column> columns = {{"limit", Table::Align::Right},
                                        {"hit rate", Table::Align::Right},
                                        {"of bytes", Table::Align::Right},
                                        {"hits", Table::Align::Right},
                                        {"misses", Table::Align::Right}};
  for (const std::string& strategy : tuning.others) columns.push_back({titleOf(strategy), Table::Align::Right});
  columns.push_back({"", Table::Align::Left});
  return columns;
}

std::vector<std::string> rowOf(const Tuning& tuning, const TunedLimit& limit) {
  std::vector<std::string> cells = {wholeBytes(limit.lru.limit), percent(share(limit.lru.hits, tuning.requests)),
                                    percent(share(limit.lru.hitBytes, tuning.requestedBytes)),
                                    formatCount(limit.lru.hits), formatCount(tuning.requests - limit.lru.hits)};
  for (const std::string& strategy : tuning.others) {
    cells.push_back(percent(share(hitsOf(limit, strategy), tuning.requests)));
  }
  cells.push_back(noteOn(limit));
  return cells;
}

std::vector<std::string> notesOn(const TuneReport& report) {
  const Tuning& tuning = report.tuning;
  std::vector<std::string> notes;
  notes.push_back(formatCount(tuning.requests, "request", "requests") + " of " +
                  formatCount(tuning.keys, "key", "keys") +
                  (tuning.seconds >= 60 ? " in " + formatDuration(static_cast<std::uint64_t>(tuning.seconds)) : "") +
                  "; all items together have at most " + bytes(tuning.everything));
  if (report.reportedHits) {
    notes.push_back("the running cache reported " + percent(share(*report.reportedHits, tuning.requests)) + " hits");
    if (report.reportedFirstHits > 0) {
      notes.push_back(formatCount(report.reportedFirstHits) +
                      " of these were the first request of a key that was stored before; they count as misses below");
    }
  }
  if (tuning.keysOfUnknownSize > 0) {
    notes.push_back(formatCount(tuning.keysOfUnknownSize, "key was", "keys were") +
                    " never found and have no known size: assumed to have " + bytes(tuning.assumedSize) + " each");
  }
  if (report.damagedLines > 0) {
    notes.push_back(formatCount(report.damagedLines, "line is", "lines are") + " not JSON and not counted");
  }
  return notes;
}

// With the rule that it follows from.
std::string adviceOf(const Tuning& tuning) {
  const TunedLimit* const enough = enoughLimit(tuning);
  if (enough == nullptr) return "No limit would have found anything: no item is requested twice.";
  const bool fits = enough->lru.limit <= std::numeric_limits<std::uint32_t>::max();
  return wholeBytes(enough->lru.limit) + " is enough: from there on, doubling the limit always turns less than " +
         percent(tuning.worth) + " of the requests into hits." +
         (fits ? "" : " (The library's own limits end below 4 GB.)");
}

std::string costOf(const Tuning& tuning, const TunedLimit& present) {
  const std::string has = "The present limit of " + wholeBytes(present.lru.limit) + " finds " +
                          percent(share(present.lru.hits, tuning.requests));
  const TunedLimit* const enough = enoughLimit(tuning);
  if (enough == nullptr || enough == &present) return has + ".";
  const std::string other = wholeBytes(enough->lru.limit);
  const auto misses = [&](std::uint64_t count, const char* comparative) {
    return formatCount(count) + comparative + (count == 1 ? "miss" : "misses") + " (" +
           percent(share(count, tuning.requests)) + " of the requests)";
  };
  if (enough->lru.limit > present.lru.limit) {
    return has + ": " + misses(enough->lru.hits - present.lru.hits, " more ") + " than " + other + " would have.";
  }
  return has + ": " + misses(present.lru.hits - enough->lru.hits, " fewer ") + " than " + other + ", for " +
         bytes(present.lru.limit - enough->lru.limit) + " more space.";
}

Json asJson(const Tuning& tuning, const TunedLimit& limit) {
  Json json = {{"limit", limit.lru.limit},
               {"hits", limit.lru.hits},
               {"hit_rate", share(limit.lru.hits, tuning.requests)},
               {"hit_bytes", limit.lru.hitBytes},
               {"byte_hit_rate", share(limit.lru.hitBytes, tuning.requestedBytes)}};
  for (const auto& [strategy, found] : limit.strategies) {
    Json& figures = json["strategies"][strategy] = {{"hits", found.hits}};
    if (strategy != strategies::kVideoDownload) figures["hit_bytes"] = found.hitBytes;
  }
  return json;
}

Json asJson(const Tuning& tuning, const TunedLimit* limit) {
  return limit == nullptr ? Json() : asJson(tuning, *limit);
}

}  // namespace

TuneTexts textsOf(const TuneReport& report) {
  const Tuning& tuning = report.tuning;
  TuneTexts texts;
  texts.title = report.store.empty() ? report.source : report.store + ", from " + report.source;
  texts.notes = notesOn(report);
  texts.columns = columnsOf(tuning);
  for (const TunedLimit& limit : tuning.limits) texts.rows.push_back(rowOf(tuning, limit));
  texts.advice = adviceOf(tuning);
  if (const TunedLimit* const present = presentLimit(tuning)) texts.cost = costOf(tuning, *present);
  return texts;
}

void printTuning(const TuneReport& report, Console& console) {
  const TuneTexts texts = textsOf(report);
  console.heading(texts.title);
  for (const std::string& note : texts.notes) console.line(note);
  Table table(texts.columns);
  for (const auto& row : texts.rows) table.addRow(row);
  console.raw("\n" + table.text());
  console.verdict(texts.advice, true);
  if (!texts.cost.empty()) console.raw(printable(texts.cost) + "\n");
}

Json tuningAsJson(const TuneReport& report) {
  const Tuning& tuning = report.tuning;
  Json limits = Json::array();
  for (const TunedLimit& limit : tuning.limits) limits.push_back(asJson(tuning, limit));
  Json json = {{"source", report.source},
               {"store", report.store},
               {"requests", tuning.requests},
               {"requested_bytes", tuning.requestedBytes},
               {"keys", tuning.keys},
               {"keys_of_unknown_size", tuning.keysOfUnknownSize},
               {"assumed_size", tuning.assumedSize},
               {"seconds", tuning.seconds},
               {"largest_total", tuning.everything},
               {"worth", tuning.worth},
               {"limits", std::move(limits)},
               {"enough", asJson(tuning, enoughLimit(tuning))},
               {"present", asJson(tuning, presentLimit(tuning))},
               {"damaged_lines", report.damagedLines}};
  if (report.reportedHits) {
    json["reported_hits"] = *report.reportedHits;
    json["reported_first_hits"] = report.reportedFirstHits;
  }
  return json;
}

}  // namespace velmora::mobile::xplat::cellar::tools
