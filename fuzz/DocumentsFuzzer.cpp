// Documents that the program has written itself and reads again: `cellar tune --merge` and `cellar inspect --since`.
// Any other document is refused with its name.
//
// The first byte of the input chooses the command, the others are the document.

#include <cstdint>
#include <filesystem>
#include <string>
#include <vector>

#include "harness/ByteReader.h"
#include "harness/Check.h"
#include "harness/Command.h"
#include "harness/Fuzzing.h"
#include "harness/Scratch.h"
#include "page/Page.h"

namespace velmora::mobile::xplat::cellar::fuzz {
namespace {

// Both forms of a report, or the same refusal twice.
Outcome runTwice(const std::vector<std::string>& arguments, const std::vector<std::string>& more,
                 const std::string& document) {
  const Outcome text = runCommand(arguments);
  checkText(text.output);
  std::vector<std::string> asJson = arguments;
  asJson.insert(asJson.end(), more.begin(), more.end());
  Outcome json = runCommand(asJson);
  check(json.status == text.status && json.reason == text.reason, "the form decides on nothing else", json.reason);
  if (json.status == 0) {
    checkJson(json.output);
  } else {
    const bool isNamed =
        json.reason.find(document) != std::string::npos || json.reason.find("compare") != std::string::npos;
    check(isNamed, "a refusal names the document", json.reason);
  }
  return json;
}

void merge(const Scratch& scratch, const std::string& document) {
  const Outcome outcome =
      runTwice({"tune", "--merge", document},
               {"--json", "--svg=" + scratch.file("svg"), "--html=" + scratch.file("html")}, document);
  if (outcome.status != 0) return;
  checkSvg(scratch.read("svg"));
  checkPage(scratch.read("html"), tools::kTunePage);
}

void compare(const Scratch& scratch, const std::string& document) {
  const std::string store = scratch.file("root") + "/caches/_sessionlessStore/thumbs_v1";
  std::filesystem::create_directories(store);
  (void)scratch.write("root/caches/_sessionlessStore/thumbs_v1/file", "value");
  (void)runTwice({"inspect", scratch.file("root"), "--since", document}, {"--json"}, document);
}

void run(ByteReader input) {
  const Scratch scratch;
  const bool isMerge = input.byte() % 2 == 0;
  const std::string document = scratch.write("document.json", input.rest());
  isMerge ? merge(scratch, document) : compare(scratch, document);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::fuzz

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  velmora::mobile::xplat::cellar::fuzz::run({data, size});
  return 0;
}
