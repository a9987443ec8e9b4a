// `cellar tune --csv` on any table: refused with a reason, or reported as the target `events` has it.
//
// Two bytes of the input choose the options, four more each of the two numbers among them; the others are the table.
// Its columns have the names that are given here.

#include <cstdint>
#include <string>
#include <vector>

#include "harness/ByteReader.h"
#include "harness/Fuzzing.h"
#include "harness/Scratch.h"
#include "harness/TuneCommand.h"

namespace velmora::mobile::xplat::cellar::fuzz {
namespace {

std::vector<std::string> optionsFrom(ByteReader& input) {
  static const std::vector<std::string> choices = {
      "--time=t",        "--op=o",        "--store-op=set",         "--remove-op=del",
      "--clear-op=out",  "--item-type=i", "--chunk-second=c",       "--unknown-size=4294967295",
      "--limit=3000",    "--worth=0.001", "--strategy=greedy_dual", "--strategy=video_download",
      "--store=a\x1b[m",
  };
  const auto chosen = input.integer<std::uint16_t>();
  const auto isChosen = [chosen](std::size_t bit) { return ((static_cast<unsigned>(chosen) >> bit) & 1U) != 0; };
  std::vector<std::string> options = {"--csv", "--key=k", "--size=s"};
  for (std::size_t bit = 0; bit < choices.size(); ++bit) {
    if (isChosen(bit)) options.push_back(choices[bit]);
  }
  const std::size_t next = choices.size();
  if (isChosen(next)) options.push_back("--priority-weight=" + std::to_string(input.integer<std::int32_t>()));
  if (isChosen(next + 1)) options.push_back("--early-seconds=" + std::to_string(input.integer<std::int32_t>()));
  if (isChosen(next + 2)) options.emplace_back("--sample=50%");
  return options;
}

void run(ByteReader input) {
  const Scratch scratch;
  const std::vector<std::string> options = optionsFrom(input);
  checkTune(scratch, input.rest(), options);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::fuzz

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  velmora::mobile::xplat::cellar::fuzz::run({data, size});
  return 0;
}
