#include "verify/Verify.h"

#include <CLI/CLI.hpp>
#include <memory>
#include <optional>
#include <string>

#include "Console.h"
#include "Format.h"
#include "Printable.h"
#include "Progress.h"
#include "host/RootLock.h"
#include "storage/Layout.h"
#include "storage/UntouchedFiles.h"
#include "verify/Verification.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr int kSound = 0;
constexpr int kFound = 1;

struct VerifyOptions {
  std::string root;
  bool repair = false;
};

std::string verdictOf(const VerificationResult& result, bool repair) {
  const std::string stores = formatCount(result.stores, "store", "stores");
  if (result.findings == 0) return "Nothing found in " + stores;
  std::string verdict = formatCount(result.findings, "finding", "findings") + " in " + stores;
  if (repair) verdict += ", " + formatCount(result.repaired) + " repaired";
  return verdict;
}

int runVerify(const VerifyOptions& options) {
  Console console = Console::standardOutput();
  const Layout layout = findLayout(options.root);
  auto progress = std::make_unique<Progress>(console, "looking at files");
  const std::uint64_t files = console.isTerminal() ? countFiles(layout.root) : 0;
  std::uint64_t seen = 0;
  const VerificationResult result = verify(
      layout, options.repair, [&](std::uint64_t /*bytes*/) { progress->advanceTo(++seen, files); },
      [&console](const std::string& line) {
        if (console.isTerminal()) console.rewriteLine("");
        console.raw(printable(line) + "\n");
      });
  progress.reset();
  console.raw(verdictOf(result, options.repair) + "\n");
  if (result.repaired > 0 && !result.isLocked) {
    console.raw("Repaired without a lock: there is no " + host::RootLock::fileName +
                ", so an application may have been running\n");
  }
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
  verify->footer(
      "Each finding is one line: records without a file, files without a record, sizes that differ, values that do\n"
      "not have their checksum, traces of interrupted writes, damaged manifests, attributes that are not JSON.\n"
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
      "input errors.\n\n"
      "Example:\n  cellar verify /tmp/cellar-demo --repair");
  verify->callback([options, &status] { status = runVerify(*options); });
}

}  // namespace velmora::mobile::xplat::cellar::tools
