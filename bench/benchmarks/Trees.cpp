#include <fcntl.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <cstddef>
#include <cstdio>
#include <filesystem>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include <cellar/AttributeStore.h>
#include <cellar/DiskSizeCalculator.h>
#include <cellar/FileUtils.h>
#include <cellar/TrashCollector.h>
#include <cellar/host/ThreadQueueFactory.h>

#include "benchmarks/Benchmarks.h"
#include "support/Fill.h"
#include "support/Samples.h"
#include "support/Stopwatch.h"
#include "support/Values.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr std::size_t kFilesInADirectory = 100;
constexpr std::size_t kFileSize = 100;

std::size_t directoriesFor(std::size_t files) { return std::max<std::size_t>(1, files / kFilesInADirectory); }

// Runs a program with its output thrown away, and waits for it; microseconds.
double timeOf(std::vector<std::string> command) {
  std::vector<char*> arguments;
  for (auto& word : command) arguments.push_back(word.data());
  arguments.push_back(nullptr);
  posix_spawn_file_actions_t actions{};
  ::posix_spawn_file_actions_init(&actions);
  ::posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
  const Stopwatch watch;
  pid_t child = 0;
  int status = -1;
  const bool ran = ::posix_spawnp(&child, arguments[0], &actions, nullptr, arguments.data(), environ) == 0 &&
                   ::waitpid(child, &status, 0) == child;
  const double taken = watch.microseconds();
  ::posix_spawn_file_actions_destroy(&actions);
  if (!ran || status != 0) throw std::runtime_error(command[0] + " failed");
  return taken;
}

// A tree to be measured, again and again.
class MeasuredTree {
 public:
  MeasuredTree(const Place& place, std::size_t files) : files_(files), scratch_(place) {
    fillTree(scratch_ / "tree", files, directoriesFor(files));
  }

  double fresh() {
    forget();
    const double taken = measure();
    return taken / static_cast<double>(files_);
  }

  double kept() {
    fresh();
    std::vector<double> samples;
    for (int i = 0; i < 101; ++i) samples.push_back(measure());
    return median(samples);
  }

  double du() {
    forget();
    return timeOf({"du", "-s", scratch_ / "tree"}) / static_cast<double>(files_);
  }

 private:
  void forget() {
    for (std::size_t i = 0; i < directoriesFor(files_); ++i) {
      std::filesystem::remove(scratch_ / "tree/" + std::to_string(i) + "/" + AttributeStore::fileName);
    }
    std::filesystem::remove(scratch_ / "tree/" + AttributeStore::fileName);
  }

  double measure() {
    const auto files = std::make_shared<FileUtils>();
    DiskSizeCalculator calculator(files, std::make_shared<AttributeStore>(files), nullptr);
    const Stopwatch watch;
    const auto stats = calculator.calculateDirectorySize(scratch_ / "tree");
    const double taken = watch.microseconds();
    const auto expected = static_cast<long long>(files_);
    if (stats.fileCount < expected || stats.size < expected * static_cast<long long>(kFileSize)) {
      throw std::runtime_error("not all files were counted");
    }
    return taken;
  }

  const std::size_t files_;
  const Scratch scratch_;
};

void measureSizes(const Context& context, const Place& place) {
  const std::size_t files = context.scaled<std::size_t>(100'000, 10'000);
  MeasuredTree tree(place, files);
  MeasuredTree small(place, files / 100);
  const std::string name = countName(files) + " files in " + countName(directoriesFor(files)) + " directories";
  const Figures figures = interleaved(
      place, {{"ours", [&] { return tree.fresh(); }}, {"du", [&] { return tree.du(); }}}, context.scaled(5, 3), 0);
  context.report.add(Row{"measuring " + name, place.name, cpuName(false), "us a file", figures, {{"du", 1.3}}});
  const double kept = tree.kept();
  const double keptOfSmall = small.kept();
  context.report.add(Row{"measuring, from the cache", place.name, cpuName(false), "us", {{"ours", kept}}, {}});
  context.report.add(Row{"from the cache, " + countName(files) + " files against " + countName(files / 100),
                         place.name,
                         cpuName(false),
                         "times",
                         {{"ours", kept / keptOfSmall}},
                         {{"", 1.3}}});
}

std::shared_ptr<TrashCollector> collectorFor(const std::string& trash,
                                             const std::shared_ptr<TaskQueueFactory>& queues) {
  return std::make_shared<TrashCollector>(trash, std::make_shared<FileUtils>(), nullptr, queues);
}

// The call alone; the background pass that follows it is waited for outside the time taken.
double collecting(const Scratch& scratch, std::size_t files) {
  const auto queues = std::make_shared<host::ThreadQueueFactory>();
  const auto collector = collectorFor(scratch / "trash", queues);
  const std::string tree = scratch / "tree";
  fillTree(tree, files, directoriesFor(files));
  const Stopwatch watch;
  const bool isCollected = collector->collectPath(tree);
  const double taken = watch.microseconds();
  if (!isCollected || std::filesystem::exists(tree)) throw std::runtime_error("the tree was not collected");
  collector->emptyAllTrash();
  queues->shutDown();
  return taken;
}

// A directory made and a tree moved into it.
double moving(const Scratch& scratch, std::size_t files) {
  constexpr mode_t mode = 0775;
  const std::string tree = scratch / "tree";
  const std::string trash = scratch / "trash";
  fillTree(tree, files, directoriesFor(files));
  const Stopwatch watch;
  const bool isMoved = ::mkdir(trash.c_str(), mode) == 0 && std::rename(tree.c_str(), (trash + "/0").c_str()) == 0;
  const double taken = watch.microseconds();
  if (!isMoved) throw std::runtime_error("the tree was not moved");
  std::filesystem::remove_all(trash);
  return taken;
}

double emptying(const Place& place, std::size_t files) {
  const Scratch scratch(place);
  fillTree(scratch / "trash/tree", files, directoriesFor(files));
  settle(scratch.path());
  const auto collector = collectorFor(scratch / "trash", nullptr);
  const Stopwatch watch;
  collector->emptyAllTrash();
  const double taken = watch.microseconds();
  if (std::filesystem::exists(scratch / "trash/tree")) throw std::runtime_error("the trash was not emptied");
  return taken / static_cast<double>(files);
}

double removing(const Place& place, std::size_t files) {
  const Scratch scratch(place);
  fillTree(scratch / "trash/tree", files, directoriesFor(files));
  settle(scratch.path());
  return timeOf({"rm", "-rf", scratch / "trash"}) / static_cast<double>(files);
}

void measureTrash(const Context& context, const Place& place) {
  for (const std::size_t count : {std::size_t{100}, context.scaled<std::size_t>(10'000, 1'000)}) {
    const Scratch scratch(place);
    const Figures figures = interleaved(
        place,
        {{"ours", [&] { return collecting(scratch, count); }}, {"lower bound", [&] { return moving(scratch, count); }}},
        context.scaled(11, 5), 0);
    const std::string name = "collectPath of " + countName(count) + " files";
    context.report.add(Row{name, place.name, cpuName(false), "us", figures, {{"", 50}}});
  }
  const std::size_t files = context.scaled<std::size_t>(40'000, 10'000);
  const Figures figures = interleaved(
      place, {{"ours", [&] { return emptying(place, files); }}, {"rm -rf", [&] { return removing(place, files); }}},
      context.scaled(3, 3), 0);
  context.report.add(Row{
      "emptying " + countName(files) + " files", place.name, cpuName(false), "us a file", figures, {{"rm -rf", 1.1}}});
}

}  // namespace

void measureTrees(const Context& context) {
  for (const Place& place : context.places) {
    measureSizes(context, place);
    measureTrash(context, place);
  }
}

}  // namespace velmora::mobile::xplat::cellar::bench
