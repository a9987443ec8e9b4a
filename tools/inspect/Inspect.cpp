#include "inspect/Inspect.h"

#include <CLI/CLI.hpp>
#include <ctime>
#include <iostream>
#include <memory>
#include <string>

#include "Console.h"
#include "inspect/Survey.h"
#include "inspect/SurveyJson.h"
#include "inspect/SurveyText.h"
#include "storage/ConfiguredStores.h"
#include "storage/FileProgress.h"
#include "storage/Layout.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr int kDone = 0;

struct InspectOptions {
  std::string root;
  std::string configuration;
  std::size_t top = 5;
  bool json = false;
};

Survey survey(const InspectOptions& options, Console& console) {
  const ConfiguredStores configured =
      options.configuration.empty() ? ConfiguredStores() : ConfiguredStores(options.configuration);
  const Layout layout = findLayout(options.root);
  FileProgress progress(console, layout.root);
  return makeSurvey(layout, configured, options.top, std::time(nullptr),
                    [&progress](std::uint64_t bytes) { progress.advance(bytes); });
}

int runInspect(const InspectOptions& options) {
  Console console = Console::standardOutput();
  const Survey result = survey(options, console);
  if (options.json) {
    std::cout << surveyAsJson(result).dump(2, ' ', false, nlohmann::ordered_json::error_handler_t::replace)
              << std::endl;
  } else {
    printSurvey(result, console);
  }
  return kDone;
}

}  // namespace

void addInspectCommand(CLI::App& app, int& status) {
  const auto options = std::make_shared<InspectOptions>();
  CLI::App* const inspect = app.add_subcommand("inspect", "Show what a storage root, or a part of one, holds");
  inspect->add_option("ROOT", options->root, "The directory: a root with its areas, an area, a manager or a store")
      ->required();
  inspect
      ->add_option("--config", options->configuration,
                   "The configuration of the application: names, limits, what is stale, what goes first")
      ->type_name("CONFIG.json");
  inspect->add_option("--top", options->top, "How many of the largest items, and of the next to go, are listed")
      ->type_name("N")
      ->capture_default_str();
  inspect->add_flag("--json", options->json, "Print everything for machines");
  inspect->footer(
      "Nothing is changed: manifests are read from copies, no log is checkpointed, no access date moves.\n\n"
      "Held is what the values' files and the inline values take, recorded what the manifest says, on disk what the\n"
      "file system has set aside. Version tag and locale stand in no configuration: of several directories of one\n"
      "store the one used last is taken to be the present one. Video priorities are the application's, too: without\n"
      "them items go by their last use.\n\n"
      "Example:\n  cellar inspect /tmp/cellar-demo --config media-app.json --top 3");
  inspect->callback([options, &status] { status = runInspect(*options); });
}

}  // namespace velmora::mobile::xplat::cellar::tools
