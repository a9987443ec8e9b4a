#include "verify/Verify.h"

#include <CLI/CLI.hpp>
#include <memory>
#include <optional>
#include <string>

#include "Console.h"
#include "Format.h"
#include "Printable.h"
#include "Progress.h"
#include "StopSignals.h"
#include "host/RootLock.h"
#include "storage/ConfiguredStores.h"
#include "storage/Layout.h"
#include "storage/UntouchedFiles.h"
#include "verify/Verification.h"
#include "verify/VerificationJson.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr int kSound = 0;
constexpr int kFound = 1;
constexpr int kNothingThere = 3;

struct VerifyOptions {
  std::string root;
  std::string configuration;
  bool repair = false;
  bool json = false;
};

std::string verdictOf(const VerificationResult& result, bool repair) {
  const std::string stores = formatCount(result.stores, "store", "stores");
  if (result.findings == 0) return "Nothing found in " + stores;
  std::string verdict = formatCount(result.findings, "finding", "findings") + " in " + stores;
  if (repair) verdict += ", " + formatCount(result.repaired) + " repaired";
  return verdict;
}

VerificationResult verifyOnConsole(const VerifyOptions& options, const Layout& layout, Console& console) {
  const ConfiguredStores configured =
      options.configuration.empty() ? ConfiguredStores() : ConfiguredStores(options.configuration);
  Progress progress(console, "looking at files");
  const std::uint64_t files = console.isTerminal() ? countFiles(layout.root) : 0;
  std::uint64_t seen = 0;
  const StopSignals stop;
  const auto onFile = [&](std::uint64_t /*bytes*/) {
    stop.throwIfCome();
    progress.advanceTo(++seen, files);
  };
  return verify(layout, configured, options.repair, onFile, [&](const std::string& line) {
    if (options.json) return;
    if (console.isTerminal()) console.rewriteLine("");
    console.raw(printable(line) + "\n");
  });
}

void printVerdict(const VerifyOptions& options, const VerificationResult& result, Console& console) {
  console.raw(verdictOf(result, options.repair) + "\n");
  if (result.repaired > 0 && !result.isLocked) {
    console.raw("Repaired without a lock: there is no " + host::RootLock::fileName +
                ", so an application may have been running\n");
  }
}

int runVerify(const VerifyOptions& options) {
  Console console = Console::standardOutput();
  const Layout layout = findLayout(options.root);
  const VerificationResult result = verifyOnConsole(options, layout, console);
  const bool isEmpty = layout.kind == Layout::Kind::Empty;
  if (options.json) {
    console.raw(printable(verificationAsJson(layout, result), 2) + "\n");
  } else if (isEmpty) {
    console.raw("Nothing to verify: " + printable(layout.root) + " is empty\n");
  } else {
    printVerdict(options, result, console);
  }
  if (isEmpty) return kNothingThere;
  const std::uint64_t remaining = options.repair ? result.findings - result.repaired : result.findings;
  return remaining == 0 ? kSound : kFound;
}

}  // namespace

void addVerifyCommand(CLI::App& app, int& status) {
  const auto options = std::make_shared<VerifyOptions>();
  CLI::App* const verify = app.add_subcommand("verify", "Compare the records of stores with their files, and repair");
  verify->add_option("ROOT", options->root, "The directory: a root with its areas, an area, a manager or a store")
      ->required();
  verify->add_flag("--repair", options->repair, "Repair what is found, without losing a value");
  verify
      ->add_option("--config", options->configuration,
                   "The configuration of the application: which stores have a manifest, and which are safe")
      ->type_name("CONFIG.json");
  verify->add_flag("--json", options->json, "Print everything for machines");
  verify->footer(
      "Each finding is one line: records without a file, files without a record, sizes that differ, values that do\n"
      "not have their checksum, traces of interrupted writes, damaged manifests, attributes that are not JSON,\n"
      "triggers, views and further tables in a manifest, which no store uses, and manifests that are missing: where\n"
      "one of the database's other files is left, or where --config says that the store has keys, and it has files.\n"
      "Without --repair nothing is changed.\n\n"
      "--repair gives a record the size of its file, and removes a record without a value. A file without a record\n"
      "is moved to \"_cellar_quarantine\" beside the managers' directories, and so is a damaged value, and a damaged\n"
      "manifest with all files of its store, which then starts empty. Of a safe store, files of earlier values and\n"
      "unfinished ones are deleted; a damaged manifest is left to the store, which salvages it, and its directory\n"
      "\"quarantine\" to you. Of other stores only records are deleted.\n"
      "Stop the application first: a running store must not be repaired, and a write in progress looks like a\n"
      "finding. --repair holds the lock of the host (_cellar_lock), and refuses while somebody else holds it. Of a\n"
      "host without a lock it refuses each store whose manifest another process has open, and says so; an\n"
      "application that starts meanwhile is not kept away then. No link is followed when something is created,\n"
      "renamed, removed or written. Without --repair no lock is taken.\n\n"
      "Exit status: 0 when nothing was found or everything is repaired, 1 when something remains, 2 for usage and\n"
      "input errors, 3 when ROOT is empty, so that there was nothing to verify.\n\n"
      "Example:\n  cellar verify /tmp/cellar-demo --repair");
  verify->callback([options, &status] { status = runVerify(*options); });
}

}  // namespace velmora::mobile::xplat::cellar::tools
