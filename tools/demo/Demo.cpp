#include "demo/Demo.h"

#include <exception>
#include <filesystem>

#include "Console.h"
#include "Format.h"
#include "InputError.h"
#include "Stopwatch.h"
#include "demo/DemoContext.h"
#include "demo/DemoReport.h"
#include "demo/DemoRoot.h"
#include "demo/DemoSteps.h"
#include "demo/SourceFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// What the stores take on disk beside the files themselves: directories, attributes, manifests, pictures, videos.
constexpr std::uint64_t kSpareBytes = 160U << 20U;

// Every file is copied into a directory and stored by key; where there are but a few, each store gets one of them.
std::uint64_t neededBytes(const SourceFiles& source) {
  constexpr std::size_t few = 10;
  return source.bytes * (source.files.size() < few ? few : 2) + kSpareBytes;
}

void requireSpace(const SourceFiles& source, const std::string& root) {
  const std::uint64_t needed = neededBytes(source);
  const std::uint64_t available = std::filesystem::space(root).available;
  if (available >= needed) return;
  throw InputError("the demo needs " + formatSize(needed) + " in '" + root + "', and only " + formatSize(available) +
                   " are free");
}

void introduce(Console& console, const DemoOptions& options, const SourceFiles& source, const DemoRoot& root) {
  console.heading("A day in the life of an application's storage");
  std::string files = formatFiles({source.files.size(), source.bytes});
  if (source.isPart) files += " of more";
  if (source.unreadable > 0) files += ", " + formatCount(source.unreadable) + " unreadable left out";
  console.line("files from   " + options.directory + " (" + files + ")");
  console.line("stores under " + root.path() + (root.isTemporary() ? " (removed at the end)" : ""));
}

// False when the step could not be played to its end: the ones after it have nothing to build on.
bool play(const DemoStep& step, DemoContext& context) {
  const std::size_t passedBefore = context.checks.passed();
  const std::size_t failedBefore = context.checks.failed();
  bool isOver = false;
  try {
    step.run(context);
    context.noteSizes();
    isOver = true;
  } catch (const std::exception& error) {
    context.checks.equal("end of the step", "reached", error.what());
  }
  context.checkLog();
  const std::size_t passed = context.checks.passed() - passedBefore;
  if (context.checks.failed() == failedBefore) {
    context.console.good(formatCount(passed, "check", "checks") + " passed");
  }
  return isOver;
}

void playAll(DemoContext& context) {
  std::size_t number = 0;
  for (const DemoStep& step : demoSteps()) {
    context.console.heading(std::to_string(++number) + ". " + step.title);
    if (!play(step, context)) return;
  }
}

bool printVerdict(const Checks& checks, std::chrono::nanoseconds time, Console& console) {
  const bool isGood = checks.failed() == 0;
  console.verdict((isGood ? "PASSED: " : "FAILED: ") + formatCount(checks.passed(), "check", "checks") + " passed, " +
                      formatCount(checks.failed()) + " failed (" + formatTime(time) + ")",
                  isGood);
  return isGood;
}

}  // namespace

bool runDemo(const DemoOptions& options, Console& console) {
  const Stopwatch watch;
  DemoRoot::requireOutside(options.root, options.directory);
  const SourceFiles source = readSourceFiles(options.directory, options.root);
  const DemoRoot root(options.root);
  requireSpace(source, root.path());
  introduce(console, options, source, root);

  DemoContext context(console, source, root.path());
  playAll(context);
  if (context.isRunning()) printStores(context);
  printValues(context);
  context.stop();
  printEvents(context);
  return printVerdict(context.checks, watch.elapsed(), console);
}

}  // namespace velmora::mobile::xplat::cellar::tools
