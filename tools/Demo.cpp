#include "Demo.h"

#include <exception>
#include <filesystem>

#include "Console.h"
#include "DemoContext.h"
#include "DemoRoot.h"
#include "DemoSteps.h"
#include "Format.h"
#include "InputError.h"
#include "PruneStrategy.h"
#include "SourceFiles.h"
#include "Stopwatch.h"
#include "Table.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// What the stores take on disk beside the files themselves: directories, attributes, pictures.
constexpr std::uint64_t kSpareBytes = 64U << 20U;

void requireSpace(const SourceFiles& source, const std::string& root) {
  const std::uint64_t needed = source.bytes + kSpareBytes;
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

// The beginnings of videos, up to this second, count as if they had been used an hour later than they were.
void preferBeginningsOfVideos() {
  VideoDownloadPruneStrategy::priorityWeight = 3600;
  VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = 10;
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

std::string kindOf(const StoreDefinition& store) {
  switch (store.type) {
    case StoreDefinition::Type::Unmanaged:
      return store.isCache ? "unmanaged cache" : "unmanaged";
    case StoreDefinition::Type::PKVS:
      return "key-value";
    case StoreDefinition::Type::DiskCache:
      return "disk cache";
  }
  return "";
}

std::string limitOf(const StoreDefinition& store) {
  if (store.maxSize > 0) return formatSize(store.maxSize);
  const auto* const keyValue = dynamic_cast<const PKVSDefinition*>(&store);
  if (keyValue == nullptr || !keyValue->capacity) return "none";
  return formatCount(static_cast<std::uint64_t>(*keyValue->capacity), "value", "values");
}

void printStores(DemoContext& context) {
  using Align = Table::Align;
  Table table({{"manager", Align::Left},
               {"kind", Align::Left},
               {"directory", Align::Left},
               {"files", Align::Right},
               {"size", Align::Right},
               {"limit", Align::Right},
               {"left", Align::Right}});
  for (const auto& store : context.stores()) {
    const TreeSize most = context.fullest[store->name];
    const TreeSize left = sizeOfTree(context.app().expectedDirectory(*store));
    table.addRow({store->managerName, kindOf(*store), context.shortDirectory(*store), formatCount(most.files),
                  formatSize(most.bytes), limitOf(*store), left.files == 0 ? "-" : formatSize(left.bytes)});
  }
  context.console.heading("The stores, at their fullest and what is left of them");
  context.console.raw(table.text());
}

void printEvents(DemoContext& context) {
  Table table({{"event", Table::Align::Left}, {"count", Table::Align::Right}});
  for (const auto& [name, count] : context.events.countsByName()) table.addRow({name, formatCount(count)});
  context.console.heading("What was reported to analytics");
  context.console.raw(table.text());
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
  preferBeginningsOfVideos();
  playAll(context);
  if (context.isRunning()) printStores(context);
  context.stop();
  printEvents(context);
  return printVerdict(context.checks, watch.elapsed(), console);
}

}  // namespace velmora::mobile::xplat::cellar::tools
