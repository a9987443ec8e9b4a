#include "inspect/Inspect.h"

#include <CLI/CLI.hpp>
#include <algorithm>
#include <ctime>
#include <filesystem>
#include <limits>
#include <memory>
#include <optional>
#include <string>

#include "Console.h"
#include "FileUtils.h"
#include "InputError.h"
#include "JsonPlace.h"
#include "NumberWithin.h"
#include "Printable.h"
#include "Progress.h"
#include "StopSignals.h"
#include "TextFile.h"
#include "inspect/Growth.h"
#include "inspect/Survey.h"
#include "inspect/SurveyJson.h"
#include "inspect/SurveyText.h"
#include "inspect/Watch.h"
#include "page/Page.h"
#include "storage/ConfiguredStores.h"
#include "storage/FileSystemSize.h"
#include "storage/Layout.h"
#include "storage/UntouchedFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr int kDone = 0;
constexpr int kIncomplete = 1;

constexpr const char* kFooter =
    "Nothing is changed: manifests are read from copies, no log is checkpointed, access dates remain.\n\n"
    "\"Held\" is the size of the values in files and inline, \"recorded\" the size in the manifest, \"on disk\" what\n"
    "the file system has allocated. The configuration contains neither version tag nor locale: of several\n"
    "directories of one store, the last used one counts as the present one. What is evicted next is listed by the\n"
    "configured strategy, as far as the disk tells: without the weights of videos that an application sets, and for\n"
    "greedy_dual as after a restart. Without a configuration it is listed by last use (lru).\n"
    "\"Durability\" is the configured one; without a configuration it is \"checksums\" when the manifest has some, as\n"
    "that of a safe or synced store has.\n\n"
    "With --watch, \"came\" and \"gone\" count items since the first look. Why an item has gone the disk does not "
    "tell,\n"
    "and what comes and goes between two looks is not seen.\n\n"
    "What cannot be read, because it is not a regular file or too large or for the reason that the system gives, is\n"
    "listed at the end.\n\n"
    "Exit status: 0, 1 when a part could not be read, 2 for usage and input errors. Damage is shown, and is what\n"
    "cellar verify is for.\n\n"
    "Examples:\n"
    "  cellar inspect /tmp/cellar-demo --config media-app.json --top 3\n"
    "  cellar inspect /tmp/cellar-demo --html storage.html\n"
    "  cellar inspect /tmp/cellar-demo --since yesterday.json";

struct InspectOptions {
  std::string root;
  std::string configuration;
  std::size_t top = 5;
  bool json = false;
  std::string page;
  std::string since;
  bool watch = false;
  double every = 2;  // seconds
};

// Inspecting must not change anything in ROOT. A ROOT that cannot be found is refused by whoever looks into it.
void requireOutside(const std::string& root, const std::string& page) {
  namespace fs = std::filesystem;
  std::error_code error;
  const fs::path outer = fs::canonical(root, error);
  if (error) return;
  const fs::path inner = targetOf(page);
  const bool isInside = std::mismatch(outer.begin(), outer.end(), inner.begin(), inner.end()).first == outer.end();
  if (isInside) throw InputError("cannot write the page '" + page + "': it would be in ROOT");
}

ConfiguredStores configuredBy(const InspectOptions& options) {
  return options.configuration.empty() ? ConfiguredStores() : ConfiguredStores(options.configuration);
}

Survey survey(const InspectOptions& options, Console& console) {
  const ConfiguredStores configured = configuredBy(options);
  const Layout layout = findLayout(options.root);
  Progress progress(console, "looking at files");
  const std::uint64_t files = console.isTerminal() ? countFiles(layout.root) : 0;
  std::uint64_t seen = 0;
  const StopSignals stop;
  const auto onFile = [&](std::uint64_t /*bytes*/) {
    stop.throwIfCome();
    progress.advanceTo(++seen, files);
  };
  Survey result = makeSurvey(layout, configured, options.top, std::time(nullptr), onFile);
  FileUtils fileUtils;
  result.fileSystemBytes = fileSystemSize(layout.root, fileUtils);
  return result;
}

int watch(const InspectOptions& options, Console& console) {
  const ConfiguredStores configured = configuredBy(options);
  const StopSignals stop;
  Watch watch(console);
  do {
    watch.show(makeSurvey(
        findLayout(options.root), configured, 0, std::time(nullptr), [](std::uint64_t) {}, true));
  } while (!stop.comeWithin(options.every));
  return kDone;
}

// The survey as others read it, so that names that are not printable are the same in both.
Growth growthUntil(const nlohmann::ordered_json& now, const std::string& since) {
  const nlohmann::json before = readJsonFile(since);
  return growthBetween(momentOf(before, since), momentOf(nlohmann::json::parse(printable(now, -1)), "ROOT"));
}

int runInspect(const InspectOptions& options) {
  const bool hasPage = !options.page.empty();
  if (hasPage) requireOutside(options.root, options.page);
  requireOther(options.page, {options.configuration, options.since});
  Console console = Console::standardOutput();
  if (options.watch) return watch(options, console);
  const Survey result = survey(options, console);
  nlohmann::ordered_json document = surveyAsJson(result);
  std::optional<Growth> growth;
  if (!options.since.empty()) {
    growth = growthUntil(document, options.since);
    document["changes"] = growthAsJson(*growth);
  }
  const std::string json = printable(document, 2);
  if (hasPage) writeTextFile(options.page, pageOf(kInspectPage, json));
  if (options.json) {
    console.raw(json + "\n");
  } else if (growth) {
    printGrowth(*growth, console);
  } else if (!hasPage) {
    printSurvey(result, console);
  }
  return result.unreadable.empty() ? kDone : kIncomplete;
}

}  // namespace

void addInspectCommand(CLI::App& app, int& status) {
  const auto options = std::make_shared<InspectOptions>();
  CLI::App* const inspect = app.add_subcommand("inspect", "Show what is in a storage root or a part of one");
  inspect->add_option("ROOT", options->root, "The directory: a root with its areas, an area, a manager or a store")
      ->required();
  inspect
      ->add_option("--config", options->configuration,
                   "The configuration of the application: names, limits, what is stale, what is evicted next")
      ->type_name("CONFIG.json");
  inspect->add_option("--top", options->top, "How many of the largest items, and of the next to be evicted, are listed")
      ->type_name("N")
      ->check(CLI::Range(0, std::numeric_limits<int>::max()).description(""))
      ->capture_default_str();
  CLI::Option* const json = inspect->add_flag("--json", options->json, "Print everything for machines");
  CLI::Option* const page =
      inspect->add_option("--html", options->page, "Write a page with charts to this file, which needs no other files")
          ->type_name("FILE");
  CLI::Option* const since =
      inspect->add_option("--since", options->since, "Show what has changed since this document of inspect --json")
          ->type_name("FILE.json");
  CLI::Option* const watch =
      inspect->add_flag("--watch", options->watch, "Look again and again, until SIGINT (Ctrl-C) or SIGTERM")
          ->excludes(json, page, since);
  inspect->add_option("--every", options->every, "How long to wait between two looks")
      ->type_name("SECONDS")
      ->check(numberWithin(0.1, 86400))
      ->needs(watch)
      ->capture_default_str();
  inspect->footer(kFooter);
  inspect->callback([options, &status] { status = runInspect(*options); });
}

}  // namespace velmora::mobile::xplat::cellar::tools
