// `cellar check` on any document: it refuses what the library refuses, names places that are there, and shows whatever
// the document contains.
//
// The first byte of the input chooses the options, the others are the document.

#include <algorithm>
#include <cstdint>
#include <exception>
#include <nlohmann/json.hpp>
#include <string>
#include <vector>

#include "Configuration.h"
#include "harness/ByteReader.h"
#include "harness/Check.h"
#include "harness/Command.h"
#include "harness/Fuzzing.h"
#include "harness/Scratch.h"

namespace velmora::mobile::xplat::cellar::fuzz {
namespace {

using Json = nlohmann::json;

constexpr int kClean = 0;
constexpr int kErrors = 2;

std::vector<std::string> optionsFrom(std::uint8_t byte, const Scratch& scratch) {
  static const std::vector<std::string> choices = {"--version-tag=250",    "--version-tag=\x1b\xff", "--locale=en_US",
                                                   "--locale=\u202e-\x07", "--session=alice",        "--session=../\n"};
  std::vector<std::string> options;
  for (std::size_t bit = 0; bit < choices.size(); ++bit) {
    if (((static_cast<unsigned>(byte) >> bit) & 1U) != 0) options.push_back(choices[bit]);
  }
  if ((byte & 128U) != 0) options.push_back("--root=" + scratch.path());
  return options;
}

bool isAccepted(const std::string& document) {
  try {
    (void)Configuration(document);
    return true;
  } catch (const std::exception&) {
    return false;
  }
}

bool hasRepeatedKeys(const Json& report) {
  const Json& warnings = report.at("warnings");
  return std::any_of(warnings.begin(), warnings.end(),
                     [](const Json& warning) { return warning.at("kind") == "repeated_key"; });
}

// A value that is meant may be missing, but not what it would be in.
void checkPlaces(const Json& diagnostics, const Json& document) {
  for (const Json& diagnostic : diagnostics) {
    const std::string path = diagnostic.at("path");
    check(path.empty() || document.contains(Json::json_pointer(path).parent_pointer()), "a place is in the document",
          path);
  }
}

void checkReport(const Outcome& json, const std::string& document) {
  checkJson(json.output);
  const Json report = Json::parse(json.output);
  const bool isRefused = !report.at("errors").empty();
  check(isRefused == !isAccepted(document), "what the library refuses is refused", json.output);
  check(isRefused == (json.status == kErrors), "a refusal has its status", json.output);
  if (!isRefused) check(report.at("warnings").empty() == (json.status == kClean), "warnings have their status");
  const Json parsed = Json::parse(document, nullptr, false);
  if (parsed.is_discarded() || hasRepeatedKeys(report)) return;  // a place may be in what was replaced
  checkPlaces(report.at("warnings"), parsed);
  checkPlaces(report.at("errors"), parsed);
}

void run(ByteReader input) {
  const Scratch scratch;
  std::vector<std::string> arguments = optionsFrom(input.byte(), scratch);
  const std::string document = input.rest();
  arguments.insert(arguments.begin(), {"check", scratch.write("storage.json", document)});
  const Outcome text = runCommand(arguments);
  checkText(text.output);
  arguments.emplace_back("--json");
  const Outcome json = runCommand(arguments);
  check(json.status == text.status && json.reason == text.reason, "the form decides on nothing else", json.reason);
  check(json.status >= kClean && json.status <= kErrors, "a check ends with one of its three statuses");
  if (json.output.empty()) {
    check(json.status == kErrors && !json.reason.empty(), "a refusal has a reason");
    check(text.output.empty(), "what cannot be read is not shown", text.output);
  } else {
    checkReport(json, document);
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::fuzz

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  velmora::mobile::xplat::cellar::fuzz::run({data, size});
  return 0;
}
