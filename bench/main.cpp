// Measures the library beside the leanest loop that does the same, and beside what applications use instead.
// `./dev bench` runs it.

#include <CLI/CLI.hpp>
#include <algorithm>
#include <exception>
#include <fstream>
#include <iostream>
#include <string>
#include <vector>

#include "benchmarks/Benchmarks.h"
#include "support/Context.h"
#include "support/Memory.h"
#include "support/Recording.h"
#include "support/Stopwatch.h"

namespace {

namespace bench = velmora::mobile::xplat::cellar::bench;

constexpr std::size_t kWarmedAtTheStart = std::size_t{1} << 30U;
constexpr std::size_t kKept = std::size_t{1} << 28U;

struct Arguments {
  bool quick = false;
  std::vector<std::string> places;
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

void run(const Arguments& arguments) {
  bench::warmMemory(kWarmedAtTheStart);
  bench::keepMemory(kKept);
  bench::Report report;
  std::vector<bench::Place> places;
  for (const auto& place : arguments.places) places.push_back(placeOf(place));
  bench::Manifests manifests(places.back());
  if (arguments.quick) places.resize(1);
  const bench::Context context{arguments.quick, places, report, manifests};
  for (const auto& benchmark : bench::benchmarks()) {
    if (!isWanted(arguments, benchmark.name)) continue;
    const bench::Stopwatch watch;
    report.begin(benchmark.name, benchmark.title);
    benchmark.measure(context);
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
  app.add_option("--place", arguments.places, "NAME:DIRECTORY to measure in")->required();
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
