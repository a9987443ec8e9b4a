#include "tune/TuneReport.h"

#include <cmath>
#include <vector>

#include "Console.h"
#include "Format.h"
#include "Printable.h"
#include "tune/Advice.h"
#include "tune/AdviceText.h"
#include "tune/FleetText.h"
#include "tune/TuneDocument.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

using Json = nlohmann::ordered_json;

std::string bytes(std::int64_t size) { return formatSize(static_cast<std::uint64_t>(size)); }

std::string wholeBytes(std::int64_t size) { return formatWholeSize(static_cast<std::uint64_t>(size)); }

std::string noteOn(const TunedLimit& limit, const Advice& advice) {
  const bool isEnough = &limit == advice.limit && !advice.isTooShort;
  if (limit.isPresent && isEnough) return "present, and enough";
  if (limit.isPresent) return "present";
  return isEnough ? "enough" : "";
}

// As a configuration names it, but for the one that no application can have.
std::string titleOf(const std::string& strategy) {
  return strategy == strategies::kForesight ? "with foresight" : strategy;
}

// The share of bytes, which a video cache's simulation is not asked for.
bool hasBytes(const std::string& strategy) { return strategy != strategies::kVideoDownload; }

std::vector<Table::Column> columnsOf(const Tuning& tuning) {
  std::vector<Table::Column> columns = {{"limit", Table::Align::Right},
                                        {titleOf(strategies::kLeastRecentlyUsed), Table::Align::Right},
                                        {"of bytes", Table::Align::Right}};
  for (const std::string& strategy : tuning.others) {
    columns.push_back({titleOf(strategy), Table::Align::Right});
    if (hasBytes(strategy)) columns.push_back({"of bytes", Table::Align::Right});
  }
  const bool isDefault = tuning.strategy == strategies::kLeastRecentlyUsed;
  columns.push_back({isDefault ? "misses" : "misses of " + tuning.strategy, Table::Align::Right});
  columns.push_back({"", Table::Align::Left});
  return columns;
}

std::vector<std::string> rowOf(const Tuning& tuning, const TunedLimit& limit, const Advice& advice) {
  std::vector<std::string> cells = {wholeBytes(limit.lru.limit), percent(share(limit.lru.hits, tuning.requests)),
                                    percent(share(limit.lru.hitBytes, tuning.requestedBytes))};
  for (const std::string& strategy : tuning.others) {
    const Found& found = limit.strategies.at(strategy);
    cells.push_back(percent(share(found.hits, tuning.requests)));
    if (hasBytes(strategy)) cells.push_back(percent(share(found.hitBytes, tuning.requestedBytes)));
  }
  cells.push_back(formatCount(tuning.requests - hitsOf(limit, tuning.strategy)));
  cells.push_back(noteOn(limit, advice));
  return cells;
}

std::vector<std::string> notesOn(const TuneReport& report) {
  const Tuning& tuning = report.tuning;
  if (report.fleet) return fleetTexts(*report.fleet, tuning);
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
    notes.push_back(formatCount(report.damagedLines, "line is", "lines are") + " damaged and not counted");
  }
  if (!report.missingStrategy.empty()) {
    notes.push_back("the present strategy \"" + report.missingStrategy + "\" cannot be simulated without metadata; \"" +
                    tuning.strategy + "\" is taken instead");
  }
  if (const std::string sample = sampleText(tuning); !sample.empty()) notes.push_back(sample);
  if (const std::string certainty = certaintyText(tuning); !certainty.empty()) notes.push_back(certainty);
  return notes;
}

Json asJson(const Tuning& tuning, const TunedLimit& limit) {
  Json json = {{"limit", limit.lru.limit},
               {"hits", limit.lru.hits},
               {"hit_rate", share(limit.lru.hits, tuning.requests)},
               {"hit_bytes", limit.lru.hitBytes},
               {"byte_hit_rate", share(limit.lru.hitBytes, tuning.requestedBytes)}};
  const bool isSample = tuning.sample.rate < 1;
  if (isSample) json["sampling_margin"] = samplingMargin(tuning, limit, strategies::kLeastRecentlyUsed);
  for (const auto& [strategy, found] : limit.strategies) {
    Json& figures = json["strategies"][strategy] = {{"hits", found.hits}};
    if (strategy != strategies::kVideoDownload) figures["hit_bytes"] = found.hitBytes;
    if (isSample) figures["sampling_margin"] = samplingMargin(tuning, limit, strategy);
  }
  return json;
}

Json asJson(const Tuning& tuning, const TunedLimit* limit) {
  return limit == nullptr ? Json() : asJson(tuning, *limit);
}

// Null for a log that is too short, or where nothing would have been found.
Json adviceAsJson(const Tuning& tuning) {
  const Advice advice = adviceOn(tuning);
  if (advice.isTooShort || advice.limit == nullptr) return {};
  const std::uint64_t hits = hitsOf(*advice.limit, advice.strategy);
  const double margin = wholeMargin(tuning, *advice.limit, advice.strategy);
  Json json = {{"strategy", advice.strategy},
               {"limit", advice.limit->lru.limit},
               {"hits", hits},
               {"hit_rate", share(hits, tuning.requests)}};
  if (std::isfinite(margin)) json["margin"] = margin;
  return json;
}

Json limitsAsJson(const Tuning& tuning) {
  Json limits = Json::array();
  for (const TunedLimit& limit : tuning.limits) limits.push_back(asJson(tuning, limit));
  return limits;
}

Json enoughAsJson(const Fleet& fleet) {
  Json json = Json::object();
  for (const auto& [strategy, limits] : fleet.enough) {
    for (const unsigned share : kShownPercentiles) json[strategy][std::to_string(share)] = enoughFor(limits, share);
  }
  return json;
}

Json fleetAsJson(const TuneReport& report) {
  const Tuning& tuning = report.tuning;
  return {{"format", kTuneFormat},
          {"source", report.source},
          {"store", report.store},
          {"devices", report.fleet->devices},
          {"short_devices", report.fleet->shortDevices},
          {"sampled_devices", report.fleet->sampledDevices},
          {"requests", tuning.requests},
          {"requested_bytes", tuning.requestedBytes},
          {"worth", tuning.worth},
          {"limits", limitsAsJson(tuning)},
          {"enough", asJson(tuning, enoughLimit(tuning))},
          {"enough_for_percent", enoughAsJson(*report.fleet)},
          {"present", nullptr},
          {"strategy", tuning.strategy},
          {"advice", adviceAsJson(tuning)}};
}

Json sampleAsJson(const SampleFigures& sample) {
  return {{"rate", sample.rate}, {"requests", sample.requests}, {"keys", sample.keys}};
}

}  // namespace

TuneTexts textsOf(const TuneReport& report) {
  const Tuning& tuning = report.tuning;
  TuneTexts texts;
  texts.title = report.store.empty() ? report.source : report.store + ", from " + report.source;
  texts.notes = notesOn(report);
  texts.columns = columnsOf(tuning);
  const Advice advice = adviceOn(tuning);
  for (const TunedLimit* const limit : limitsToShow(tuning)) texts.rows.push_back(rowOf(tuning, *limit, advice));
  texts.advice = adviceText(tuning);
  texts.cost = costText(tuning);
  return texts;
}

void printTuning(const TuneReport& report, Console& console) {
  const TuneTexts texts = textsOf(report);
  console.heading(texts.title);
  for (const std::string& note : texts.notes) console.line(note);
  Table table(texts.columns);
  for (const auto& row : texts.rows) table.addRow(row);
  console.raw("\n" + table.text());
  console.verdict(texts.advice, !adviceOn(report.tuning).isTooShort);
  if (!texts.cost.empty()) console.raw(printable(texts.cost) + "\n");
}

Json tuningAsJson(const TuneReport& report) {
  const Tuning& tuning = report.tuning;
  if (report.fleet) return fleetAsJson(report);
  Json json = {{"format", kTuneFormat},
               {"source", report.source},
               {"store", report.store},
               {"requests", tuning.requests},
               {"requested_bytes", tuning.requestedBytes},
               {"keys", tuning.keys},
               {"keys_of_unknown_size", tuning.keysOfUnknownSize},
               {"assumed_size", tuning.assumedSize},
               {"seconds", tuning.seconds},
               {"largest_total", tuning.everything},
               {"worth", tuning.worth},
               {"limits", limitsAsJson(tuning)},
               {"enough", asJson(tuning, enoughLimit(tuning))},
               {"present", asJson(tuning, presentLimit(tuning))},
               {"strategy", tuning.strategy},
               {"advice", adviceAsJson(tuning)},
               {"damaged_lines", report.damagedLines}};
  if (tuning.sample.rate < 1) json["sample"] = sampleAsJson(tuning.sample);
  if (report.reportedHits) {
    json["reported_hits"] = *report.reportedHits;
    json["reported_first_hits"] = report.reportedFirstHits;
  }
  return json;
}

}  // namespace velmora::mobile::xplat::cellar::tools
