// The program behind `./dev counts`: runs a scenario, to be watched by tools that count, and compares what they
// counted.

#include <CLI/CLI.hpp>
#include <exception>
#include <fstream>
#include <iostream>
#include <memory>
#include <stdexcept>
#include <string>

#include "counts/Comparison.h"
#include "counts/Scenario.h"

namespace bench = velmora::mobile::xplat::cellar::bench;

// Counting begins and ends with this function, which is known by its name.
extern "C" __attribute__((noinline, visibility("default"))) void cellar_counted_section(bench::Scenario* scenario) {
  scenario->run();
}

namespace {

struct Arguments {
  std::string scenario;
  std::string directory;
  bool onlyPrepare = false;
  std::string baseline;
  std::string measured;
};

void runScenario(const Arguments& arguments) {
  const auto scenario = bench::createScenario(arguments.scenario, arguments.directory);
  if (arguments.onlyPrepare) return;
  cellar_counted_section(scenario.get());
  scenario->verify();
}

bench::Counts readMeasured(const std::string& path) {
  std::ifstream file(path);
  if (!file) throw std::runtime_error("cannot read " + path);
  return bench::parseMeasured(file);
}

void record(const Arguments& arguments) {
  std::ofstream file(arguments.baseline);
  file << readMeasured(arguments.measured).dump(2) << "\n";
  if (!file.flush()) throw std::runtime_error("cannot write " + arguments.baseline);
}

int compareCounts(const Arguments& arguments) {
  std::ifstream file(arguments.baseline);
  if (!file) throw std::runtime_error("cannot read " + arguments.baseline);
  const auto baseline = bench::Counts::parse(file);
  const auto measured = readMeasured(arguments.measured);
  if (baseline.at("environment") != measured.at("environment")) {
    std::cout << "CANNOT COMPARE: the baseline was recorded with " << baseline.at("environment").dump() << ", this is "
              << measured.at("environment").dump() << "\n";
    return 0;
  }
  return bench::compare(baseline, measured, std::cout) ? 0 : 1;
}

int run(const CLI::App& app, const Arguments& arguments) {
  if (app.got_subcommand("run")) {
    runScenario(arguments);
  } else if (app.got_subcommand("record")) {
    record(arguments);
  } else if (app.got_subcommand("compare")) {
    return compareCounts(arguments);
  } else {
    for (const auto& name : bench::scenarioNames()) std::cout << name << "\n";
  }
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  Arguments arguments;
  CLI::App app("Scenarios whose instructions and system calls are counted; without a command, their names");
  CLI::App* const runCommand = app.add_subcommand("run", "Run a scenario in an empty directory");
  runCommand->add_option("scenario", arguments.scenario)->required();
  runCommand->add_option("directory", arguments.directory)->required();
  runCommand->add_flag("--only-prepare", arguments.onlyPrepare, "Do what comes before the counted part, and after it");
  for (const char* name : {"compare", "record"}) {
    CLI::App* const command = app.add_subcommand(name, "Compare counts with a baseline, or make them one");
    command->add_option("baseline", arguments.baseline)->required();
    command->add_option("measured", arguments.measured)->required();
  }
  CLI11_PARSE(app, argc, argv);
  try {
    return run(app, arguments);
  } catch (const std::exception& error) {
    std::cerr << "error: " << error.what() << "\n";
    return 2;
  }
}
