#include <glog/logging.h>

#include <CLI/CLI.hpp>
#include <csignal>
#include <exception>
#include <iostream>
#include <string>
#include <vector>

#include "Console.h"
#include "InputError.h"
#include "Printable.h"
#include "StopSignals.h"
#include "Version.h"
#include "check/Check.h"
#include "demo/Demo.h"
#include "inspect/Inspect.h"
#include "tune/Tune.h"
#include "verify/Verify.h"

namespace {

namespace tools = velmora::mobile::xplat::cellar::tools;

constexpr int kPassed = 0;
constexpr int kFailed = 1;
constexpr int kUsage = 2;

// Commands redirect the log; on the terminal it would be mixed into the output.
void keepLogOffTheTerminal(const char* program) {
  google::InitGoogleLogging(program);
  for (int severity = 0; severity < google::NUM_SEVERITIES; ++severity) google::SetLogDestination(severity, "");
  FLAGS_stderrthreshold = google::GLOG_FATAL;
}

void describe(CLI::App& app) {
  app.description(
      "Cellar manages an application's storage on a device. This program demonstrates it, inspects and repairs what "
      "it\n"
      "has stored, and helps with its configuration and its limits.");
  app.footer(
      "Examples:\n  cellar demo ~/Pictures\n  cellar check storage.json\n  cellar inspect /tmp/cellar-demo\n  cellar "
      "tune "
      "analytics.jsonl --store thumbs\n\nExit status: 0 without problems, 1 when a problem was found, 2 for usage and "
      "input errors and for an output that cannot be written, 3 when verify found ROOT empty.");
  app.set_version_flag("--version", tools::versionText());
  app.require_subcommand(1);
}

CLI::App* addDemo(CLI::App& app, tools::DemoOptions& options) {
  CLI::App* const demo = app.add_subcommand("demo", "Play a day in the life of an application's storage on real files");
  demo->add_option("DIRECTORY", options.directory, "Whose files to use")->capture_default_str();
  demo->add_option("--root", options.root,
                   "Keep the stores in this directory, with the log and the analytics events, and leave what remains\n"
                   "there to be looked at. It must be new, empty or of an earlier demo, which is cleared.\n"
                   "Without it: a temporary directory, removed at the end")
      ->type_name("DIR");
  demo->footer(
      "Stores are filled, measured, pruned, expired, evicted, cleared, retired by an update, cleaned up after\n"
      "another user, trashed and cleansed, and each step is checked against the file system. Files are copied\n"
      "twice, at most 20,000 and 200 MB of them; nothing is changed in DIRECTORY.\n\n"
      "Example:\n  cellar demo /usr/share/doc --root /tmp/cellar-demo");
  return demo;
}

int report(const std::string& problem) {
  std::cerr << "cellar: " << tools::printable(problem) << std::endl;
  return kUsage;
}

int runProgram(int argc, char** argv) {
  CLI::App app;
  tools::DemoOptions demoOptions;
  demoOptions.directory = "/usr/share";
  app.name("cellar");
  describe(app);
  int status = kPassed;
  const CLI::App* const demo = addDemo(app, demoOptions);
  tools::addInspectCommand(app, status);
  tools::addVerifyCommand(app, status);
  tools::addCheckCommand(app, status);
  tools::addTuneCommand(app, status);
  try {
    app.parse(argc, argv);
  } catch (const CLI::Success& wish) {
    return app.exit(wish);  // help or version
  } catch (const CLI::ParseError& error) {
    const std::vector<std::string> unknown = app.remaining();
    if (app.get_subcommands().empty() && !unknown.empty() && unknown.front().front() != '-') {
      return report("no command '" + unknown.front() + "' (see cellar --help)");
    }
    return report(std::string(error.what()) + " (see cellar --help)");
  }
  if (!demo->parsed()) return status;
  tools::Console console = tools::Console::standardOutput();
  return tools::runDemo(demoOptions, console) ? kPassed : kFailed;
}

}  // namespace

int main(int argc, char** argv) {
  keepLogOffTheTerminal(argv[0]);
  try {
    const int status = runProgram(argc, argv);
    return std::cout.flush() ? status : report("cannot write to the standard output");
  } catch (const tools::InputError& error) {
    return report(error.what());
  } catch (const tools::Interrupted& by) {
    (void)std::raise(by.signal);  // to end as whoever sent it expects
    return kFailed;
  } catch (const std::exception& error) {
    std::cerr << "cellar: " << tools::printable(std::string(error.what())) << std::endl;
    return kFailed;
  }
}
