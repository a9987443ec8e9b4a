#include "tune/Tune.h"

#include <CLI/CLI.hpp>
#include <cstdint>
#include <filesystem>
#include <iostream>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "Configuration.h"
#include "Console.h"
#include "Format.h"
#include "InputError.h"
#include "NumberWithin.h"
#include "Printable.h"
#include "Progress.h"
#include "PruneStrategy.h"
#include "TextFile.h"
#include "tune/CsvReader.h"
#include "tune/EventReader.h"
#include "tune/KeySample.h"
#include "tune/LineReader.h"
#include "tune/Present.h"
#include "tune/SampleScale.h"
#include "tune/Trace.h"
#include "tune/TuneDocument.h"
#include "tune/TunePage.h"
#include "tune/TunePlot.h"
#include "tune/TuneReport.h"
#include "tune/Tuning.h"
#include "tune/TuningMerge.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr double kPercent = 100;

struct TuneOptions {
  std::string events;
  std::string store;
  std::string limit;
  std::string strategy = strategies::kLeastRecentlyUsed;
  std::string configuration;
  double worth = 1;  // percent
  std::int64_t unknownSize = -1;
  std::string sample = "1";
  std::string svg;
  std::string html;
  std::vector<std::string> merge;
  bool json = false;
  bool csv = false;
  CsvColumns columns;
  int priorityWeight = 0;
  int earlySeconds = 0;
};

std::string listOf(const EventCounts& counts) {
  std::string list;
  for (const auto& [store, accesses] : counts.accessesOfStores) {
    list += (list.empty() ? "" : ", ") + store + " (" + formatCount(accesses) + ")";
  }
  return list;
}

// Fills in the other figures of the events.
void readReportedEvents(const TuneOptions& options, LineReader& lines, Trace& trace, TuneReport& report,
                        const std::function<void()>& onLine) {
  const EventCounts counts = readEvents(lines, options.store, trace, onLine);
  const std::size_t stores = counts.accessesOfStores.size();
  if (stores == 0) throw InputError("no line of " + lines.name() + " is an access event of the host kit's sink");
  if (trace.isEmpty()) {
    throw InputError(lines.name() + " has no accesses to store '" + options.store + "', but to: " + listOf(counts));
  }
  if (options.store.empty() && stores > 1) {
    throw InputError(lines.name() + " has accesses to several stores, choose one with --store: " + listOf(counts));
  }
  report.store = options.store.empty() ? counts.accessesOfStores.begin()->first : options.store;
  report.reportedHits = counts.hits;
  report.reportedFirstHits = SampleScale(trace.sample().rate(), 0, 0, 0).count(counts.firstHits);
  report.damagedLines = counts.damagedLines;
}

void readTrace(const TuneOptions& options, Console& console, Trace& trace, TuneReport& report) {
  LineReader lines(options.events);
  Progress progress(console, "reading " + lines.name());
  const auto onLine = [&] {
    const bool isKnown = lines.bytesInAll() > 0;
    progress.advanceTo(isKnown ? lines.bytesRead() : lines.lineNumber(), lines.bytesInAll());
  };
  report.source = lines.name();
  report.store = options.store;
  if (options.csv) {
    readCsv(lines, options.columns, trace, onLine);
    if (trace.isEmpty()) throw InputError(lines.name() + " has no rows");
  } else {
    readReportedEvents(options, lines, trace, report, onLine);
  }
  if (trace.keys() == 0 && !trace.sample().isWhole()) {
    throw InputError("no key of " + lines.name() + " is in a sample of " + options.sample + ", choose a larger one");
  }
}

TuneSettings settingsOf(const TuneOptions& options) {
  TuneSettings settings;
  if (options.configuration.empty()) {
    settings.present = options.limit.empty() ? 0 : parseLimit(options.limit);
    settings.strategy = options.strategy;
  } else {
    settings = configuredSettings(options.configuration, options.store);
  }
  settings.worth = options.worth / kPercent;
  return settings;
}

Tuning tuneTrace(const TuneSettings& settings, const Trace& trace, Console& console) {
  Progress progress(console, "simulating the accesses");
  return tune(trace, settings, [&](std::uint64_t done, std::uint64_t whole) { progress.advanceTo(done, whole); });
}

void write(const TuneReport& report, const TuneOptions& options, Console& console) {
  if (!options.svg.empty()) writeTextFile(options.svg, tuningAsSvg(report));
  if (!options.html.empty()) writeTextFile(options.html, tuningAsPage(report));
  if (options.json) {
    std::cout << printable(tuningAsJson(report), 2) << std::endl;
  } else {
    printTuning(report, console);
  }
}

void requireSeparateFiles(const TuneOptions& options) {
  std::vector<std::string> others = options.merge;
  others.insert(others.end(), {options.events, options.configuration});
  requireOther(options.html, others);
  others.push_back(options.html);
  requireOther(options.svg, others);
}

void runTune(const TuneOptions& options) {
  if (!options.configuration.empty() && options.store.empty()) {
    throw InputError("--config needs --store, to know which limit to read");
  }
  const TuneSettings settings = settingsOf(options);
  VideoDownloadPruneStrategy::priorityWeight = options.priorityWeight;
  VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = options.earlySeconds;

  Console console = Console::standardOutput();
  TuneReport report;
  Trace trace(KeySample(parseRate(options.sample)));
  if (options.unknownSize >= 0) trace.assumeSize(options.unknownSize);
  readTrace(options, console, trace, report);
  report.tuning = tuneTrace(settings, trace, console);
  if (report.tuning.strategy != settings.strategy) report.missingStrategy = settings.strategy;
  write(report, options, console);
}

// Each file once, by whatever names.
void requireNew(const std::string& file, std::set<std::filesystem::path>& files) {
  std::error_code ignored;
  const std::filesystem::path path = std::filesystem::weakly_canonical(file, ignored);
  if (!files.insert(path).second) throw InputError(file + ": is given twice");
}

void runMerge(const TuneOptions& options) {
  Console console = Console::standardOutput();
  TuningMerge merge;
  std::set<std::filesystem::path> files;
  {
    Progress progress(console, "reading documents");
    for (const std::string& file : options.merge) {
      requireNew(file, files);
      merge.add(file, readTuneDocument(file));
      progress.advanceTo(files.size(), options.merge.size());
    }
  }
  const MergedTuning merged = merge.result();
  TuneReport report;
  report.source = formatCount(files.size(), "document", "documents");
  report.store = merged.store;
  report.fleet = merged.fleet;
  report.tuning = merged.tuning;
  write(report, options, console);
}

void addCsvOptions(CLI::App& tune, TuneOptions& options) {
  CLI::Option* const csv =
      tune.add_flag("--csv", options.csv, "EVENTS is a table with a line of titles, separated by commas");
  const auto column = [&](const char* name, std::string& target, const char* help) {
    return tune.add_option(name, target, help)->type_name("COLUMN")->needs(csv);
  };
  csv->needs(column("--key", options.columns.key, "The column of the keys"));
  csv->needs(column("--size", options.columns.size, "The column of the sizes, in bytes; empty where not known"));
  column("--time", options.columns.time, "The column of the times, in seconds");
  CLI::Option* const op =
      column("--op", options.columns.op, "The column of the operations; all are fetches but these:");
  tune.add_option("--store-op", options.columns.stores, "An operation that stores. May be given several times")
      ->type_name("OP")
      ->needs(op);
  tune.add_option("--remove-op", options.columns.removes, "An operation that removes. May be given several times")
      ->type_name("OP")
      ->needs(op);
  tune.add_option("--clear-op", options.columns.clears,
                  "An operation that removes all items, as a log-out does. May be given several times")
      ->type_name("OP")
      ->needs(op);
}

void addVideoOptions(CLI::App& tune, TuneOptions& options) {
  CLI::Option* const csv = tune.get_option("--csv");
  const char* const group = "Video strategy";
  const auto grouped = [&](CLI::Option* option, const char* type) {
    return option->type_name(type)->needs(csv)->group(group);
  };
  grouped(tune.add_option("--chunk-second", options.columns.chunkSecond, "The column of the seconds of the video"),
          "COLUMN");
  grouped(tune.add_option("--item-type", options.columns.itemType, "The column of the item types"), "COLUMN");
  grouped(tune.add_option("--priority-weight", options.priorityWeight, "Seconds that a high priority is worth"),
          "SECONDS");
  grouped(tune.add_option("--early-seconds", options.earlySeconds, "Up to which second a chunk has high priority"),
          "SECONDS");
}

// With it, nothing is simulated: of the other options only those that say where the report goes make sense.
void addMergeOption(CLI::App& tune, TuneOptions& options) {
  const std::vector<CLI::Option*> others = tune.get_options();
  CLI::Option* const merge = tune.add_option(
      "--merge", options.merge, "Instead of EVENTS: add up what tune --json wrote of many devices, a file each");
  merge->expected(1, -1)->type_name("FILE ...");
  for (CLI::Option* const other : others) {
    const std::string name = other->get_name();
    if (name != "--svg" && name != "--html" && name != "--json" && other != tune.get_help_ptr()) merge->excludes(other);
  }
}

// Empty if `parse` takes it.
template <class Parse> CLI::Validator checkedBy(Parse parse) {
  const auto whyNot = [parse](const std::string& text) {
    try {
      (void)parse(text);
      return std::string();
    } catch (const InputError& error) {
      return std::string(error.what());
    }
  };
  return {whyNot, ""};
}

}  // namespace

void addTuneCommand(CLI::App& app, int& status) {
  const auto options = std::make_shared<TuneOptions>();
  CLI::App* const tune =
      app.add_subcommand("tune", "Find a cache's limit from the accesses that an application logged");
  tune->add_option("EVENTS", options->events, "What the host kit's sink has written, JSON lines; - for standard input")
      ->type_name("FILE");
  tune->add_option("--store", options->store, "The store's name; not needed if all events are of one store")
      ->type_name("NAME");
  CLI::Option* const limit =
      tune->add_option("--limit", options->limit, "The present limit, as a configuration has it (50MB), or in bytes")
          ->check(checkedBy(parseLimit))
          ->type_name("SIZE");
  CLI::Option* const strategy =
      tune->add_option("--strategy", options->strategy, "The present prune_strategy: lru, greedy_dual, video_download")
          ->check(CLI::IsMember({strategies::kLeastRecentlyUsed, strategies::kGreedyDual, strategies::kVideoDownload})
                      .description(""))
          ->capture_default_str()
          ->type_name("NAME");
  tune->add_option("--config", options->configuration,
                   "Take the present limit and strategy of the store from this configuration")
      ->type_name("FILE")
      ->excludes(limit)
      ->excludes(strategy);
  tune->add_option("--worth", options->worth,
                   "Percent of the requests that doubling a limit, or another strategy, has to turn into hits")
      ->check(numberWithin(0.001, 100))
      ->capture_default_str()
      ->type_name("PERCENT");
  tune->add_option("--unknown-size", options->unknownSize,
                   "Bytes of items that were never found; without it, the mean of the others")
      ->check(CLI::Range(std::int64_t{0}, std::int64_t{0xffffffff}).description(""))
      ->type_name("BYTES");
  tune->add_option("--sample", options->sample, "Simulate this share of the keys (0.01 or 1%), for logs of many keys")
      ->check(checkedBy(parseRate))
      ->type_name("RATE");
  tune->add_option("--svg", options->svg, "Draw the hit rate over the limit into this file")->type_name("FILE");
  tune->add_option("--html", options->html, "Write the report with the drawing into this file, as one page")
      ->type_name("FILE");
  tune->add_flag("--json", options->json, "Print one JSON object for machines");
  addCsvOptions(*tune, *options);
  addVideoOptions(*tune, *options);
  addMergeOption(*tune, *options);
  tune->footer(
      "Computes for every size limit how many requests a cache would have found that is pruned as soon as it is over\n"
      "its limit, with each prune_strategy. docs/tuning.md explains the figures and their limits.\n\n"
      "Examples:\n"
      "  cellar tune analytics.jsonl --store thumbs --config storage.json --svg thumbs.svg\n"
      "  cellar tune --merge devices/*.json --html devices.html\n"
      "  zcat trace.csv.gz | cellar tune - --csv --key lbn --size size --op op --store-op 2a");
  tune->callback([options, &status] {
    if (options->events.empty() && options->merge.empty()) throw CLI::RequiredError("EVENTS");
    requireSeparateFiles(*options);
    options->merge.empty() ? runTune(*options) : runMerge(*options);
    status = 0;
  });
}

}  // namespace velmora::mobile::xplat::cellar::tools
