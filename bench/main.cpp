// Measures the library beside the leanest loop that does the same, and beside what applications use instead.
// `./dev bench` runs it.

#include <CLI/CLI.hpp>
#include <algorithm>
#include <exception>
#include <fstream>
#include <iostream>
#include <optional>
#include <string>
#include <vector>

#include "benchmarks/Benchmarks.h"
#include "support/Context.h"
#include "support/Memory.h"
#include "support/OtherPrograms.h"
#include "support/Recording.h"
#include "support/Stopwatch.h"

namespace {

namespace bench = velmora::mobile::xplat::cellar::bench;

constexpr std::size_t kWarmedAtTheStart = std::size_t{1} << 30U;
constexpr double kMostOfOthers = 0.2;  // of one processor
constexpr std::size_t kKept = std::size_t{1} << 28U;

struct Arguments {
  bool quick = false;
  bool evenIfBusy = false;
  std::vector<std::string> places;
  std::string disk;
  std::vector<std::string> benchmarks;
  std::string results;
  std::string document;
  std::string summary;
  std::string plots;
};

bench::Place placeOf(const std::string& text) {
  const auto colon = text.find(':');
  return {text.substr(0, colon), text.substr(colon + 1)};
}

bool isWanted(const Arguments& arguments, const std::string& benchmark) {
  const auto& wanted = arguments.benchmarks;
  return wanted.empty() || std::find(wanted.begin(), wanted.end(), benchmark) != wanted.end();
}

// After each benchmark, so that the results so far are kept when one fails or is interrupted.
void record(const Arguments& arguments, const bench::Report& report) {
  std::ofstream(arguments.results) << report.json().dump(2) << "\n";
  if (!arguments.plots.empty()) bench::writePlotScripts(report, arguments.plots);
  if (!arguments.document.empty()) bench::recordTables(report, arguments.document);
  if (!arguments.summary.empty()) bench::recordSummaries(report, arguments.summary);
}

std::string busyText(const std::string& benchmark, const bench::OtherPrograms& others) {
  return "other programs used " + std::to_string(static_cast<int>(others.share() * 100)) + " % of a processor while '" +
         benchmark + "' was measured: its figures are not reported (--even-if-busy)";
}

void run(const Arguments& arguments) {
  bench::warmMemory(kWarmedAtTheStart);
  bench::keepMemory(kKept);
  bench::Report report;
  std::vector<bench::Place> places;
  for (const auto& place : arguments.places) places.push_back(placeOf(place));
  bench::Manifests manifests(places.back());
  const bool isOneTopic = !arguments.benchmarks.empty() && arguments.document.empty();
  if (arguments.quick || isOneTopic) places.resize(1);  // a topic is for a quick look
  std::optional<bench::Place> disk;
  if (!arguments.disk.empty()) disk = placeOf(arguments.disk);
  const bench::Context context{arguments.quick, places, disk, report, manifests};
  for (const auto& benchmark : bench::benchmarks()) {
    if (!isWanted(arguments, benchmark.name)) continue;
    const bench::Stopwatch watch;
    const bench::OtherPrograms others;
    report.begin(benchmark.name, benchmark.title);
    benchmark.measure(context);
    if (!arguments.evenIfBusy && others.share() > kMostOfOthers)
      throw std::runtime_error(busyText(benchmark.name, others));
    std::cout << "\n" << benchmark.title << "\n\n" << bench::tableText(report.sections().back()) << std::flush;
    std::cerr << benchmark.name << ": " << watch.microseconds() / 1e6 << " s\n";
    record(arguments, report);
  }
}

}  // namespace

int main(int argc, char** argv) {
  Arguments arguments;
  CLI::App app("Benchmarks of the library");
  app.add_flag("--quick", arguments.quick, "Fewer and smaller measurements");
  app.add_flag("--even-if-busy", arguments.evenIfBusy, "Report although other programs took part of the processors");
  app.add_option("--place", arguments.places, "NAME:DIRECTORY to measure in")->required();
  app.add_option("--disk", arguments.disk, "NAME:DIRECTORY on a disk, to measure syncs in");
  app.add_option("--results", arguments.results, "The file for the results, as JSON")->required();
  app.add_option("--plots", arguments.plots, "A directory for gnuplot scripts");
  app.add_option("--document", arguments.document, "The document to write the tables into");
  app.add_option("--summary", arguments.summary, "The document to write the shortened tables into");
  app.add_option("--topic", arguments.benchmarks, "Measure only this benchmark; may be repeated");
  CLI11_PARSE(app, argc, argv);
  try {
    run(arguments);
  } catch (const std::exception& error) {
    std::cerr << "error: " << error.what() << "\n";
    return 1;
  }
  return 0;
}
