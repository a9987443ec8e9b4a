#include "harness/TuneCommand.h"

#include <cstdint>
#include <nlohmann/json.hpp>

#include "harness/Check.h"
#include "harness/Command.h"
#include "page/Page.h"

namespace velmora::mobile::xplat::cellar::fuzz {

namespace {

using Json = nlohmann::json;

// Up to a limit that evicts nothing, a greater one never finds less.
void checkFigures(const std::string& text) {
  const Json report = Json::parse(text);
  const auto requests = report.at("requests").get<std::uint64_t>();
  check(report.at("seconds").get<std::int64_t>() >= 0, "time does not go back", text);
  std::uint64_t earlier = 0;
  std::int64_t lower = 0;
  for (const Json& limit : report.at("limits")) {
    const auto hits = limit.at("hits").get<std::uint64_t>();
    const auto bytes = limit.at("limit").get<std::int64_t>();
    check(bytes > lower, "limits ascend", text);
    check(hits >= earlier && hits <= requests, "hits are requests", text);
    for (const char* rate : {"hit_rate", "byte_hit_rate"}) {
      check(limit.at(rate) >= 0.0 && limit.at(rate) <= 1.0, "a rate is a share", text);
    }
    for (const Json& strategy : limit.at("strategies")) {
      check(strategy.at("hits").get<std::uint64_t>() <= requests, "hits are requests", text);
    }
    earlier = hits;
    lower = bytes;
  }
}

}  // namespace

void checkTune(const Scratch& scratch, const std::string& bytes, const std::vector<std::string>& options) {
  std::vector<std::string> arguments = {"tune", scratch.write("events", bytes)};
  arguments.insert(arguments.end(), options.begin(), options.end());
  const Outcome text = runCommand(arguments);
  checkText(text.output);
  arguments.insert(arguments.end(), {"--json", "--svg=" + scratch.file("svg"), "--html=" + scratch.file("html")});
  const Outcome json = runCommand(arguments);
  check(json.status == text.status && json.reason == text.reason, "the form decides on nothing else", json.reason);
  if (json.status != 0) {
    check(!json.reason.empty(), "a refusal has a reason");
    return;
  }
  checkJson(json.output);
  checkSvg(scratch.read("svg"));
  checkPage(scratch.read("html"), tools::kTunePage);
  checkFigures(json.output);
}

}  // namespace velmora::mobile::xplat::cellar::fuzz
