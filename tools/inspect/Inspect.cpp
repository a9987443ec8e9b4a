#include "inspect/Inspect.h"

#include <CLI/CLI.hpp>
#include <algorithm>
#include <ctime>
#include <filesystem>
#include <memory>
#include <string>

#include "Console.h"
#include "FileUtils.h"
#include "InputError.h"
#include "Printable.h"
#include "Progress.h"
#include "TextFile.h"
#include "inspect/Survey.h"
#include "inspect/SurveyJson.h"
#include "inspect/SurveyText.h"
#include "page/Page.h"
#include "storage/ConfiguredStores.h"
#include "storage/FileSystemSize.h"
#include "storage/Layout.h"
#include "storage/UntouchedFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr int kDone = 0;
constexpr int kIncomplete = 1;

struct InspectOptions {
  std::string root;
  std::string configuration;
  std::size_t top = 5;
  bool json = false;
  std::string page;
};

// Inspecting must not change anything in ROOT.
void requireOutside(const std::string& root, const std::string& page) {
  namespace fs = std::filesystem;
  std::error_code error;
  const fs::path outer = fs::canonical(root, error);
  const fs::path inner = fs::weakly_canonical(page, error);
  const bool isInside = std::mismatch(outer.begin(), outer.end(), inner.begin(), inner.end()).first == outer.end();
  if (!error && isInside) throw InputError("cannot write the page '" + page + "': it would be in ROOT");
}

Survey survey(const InspectOptions& options, Console& console) {
  const ConfiguredStores configured =
      options.configuration.empty() ? ConfiguredStores() : ConfiguredStores(options.configuration);
  const Layout layout = findLayout(options.root);
  Progress progress(console, "looking at files");
  const std::uint64_t files = console.isTerminal() ? countFiles(layout.root) : 0;
  std::uint64_t seen = 0;
  Survey result = makeSurvey(layout, configured, options.top, std::time(nullptr),
                             [&](std::uint64_t /*bytes*/) { progress.advanceTo(++seen, files); });
  FileUtils fileUtils;
  result.fileSystemBytes = fileSystemSize(layout.root, fileUtils);
  return result;
}

int runInspect(const InspectOptions& options) {
  const bool hasPage = !options.page.empty();
  if (hasPage) requireOutside(options.root, options.page);
  Console console = Console::standardOutput();
  const Survey result = survey(options, console);
  const std::string json = printable(surveyAsJson(result), 2);
  if (hasPage) writeTextFile(options.page, pageOf(kInspectPage, json));
  if (options.json) {
    console.raw(json + "\n");
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
      ->capture_default_str();
  inspect->add_flag("--json", options->json, "Print everything for machines");
  inspect->add_option("--html", options->page, "Write a page with charts to this file, which needs no other files")
      ->type_name("FILE");
  inspect->footer(
      "Nothing is changed: manifests are read from copies, no log is checkpointed, access dates remain.\n\n"
      "\"Held\" is the size of the values in files and inline, \"recorded\" the size in the manifest, \"on disk\" "
      "what\n"
      "the file system has allocated. The configuration contains neither version tag nor locale: of several\n"
      "directories of one store, the last used one counts as the present one. What is evicted next\n"
      "is listed by the configured strategy, as far as the disk tells: without the weights of videos that an "
      "application\n"
      "sets, and for greedy_dual as after a restart. Without a configuration it is listed by last use "
      "(lru).\n\"Durability\" is the configured one; without a configuration\n"
      "it is \"checksums\" when the manifest has some, as that of a safe or synced store has.\n\n"
      "What cannot be read, because it is not a regular file or too large or for the reason that the system gives, is\n"
      "listed at the end.\n\n"
      "Exit status: 0, 1 when a part could not be read, 2 for usage and input errors. Damage is shown, and is what\n"
      "cellar verify is for.\n\n"
      "Examples:\n  cellar inspect /tmp/cellar-demo --config media-app.json --top 3\n"
      "  cellar inspect /tmp/cellar-demo --html storage.html");
  inspect->callback([options, &status] { status = runInspect(*options); });
}

}  // namespace velmora::mobile::xplat::cellar::tools
