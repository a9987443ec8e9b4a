// `cellar tune` on the lines that a host kit's sink has written, or on what else may be in that file: it refuses them,
// or what it writes in each of its forms can be shown, and its figures are possible ones.
//
// The first byte of the input chooses the options, the others are the lines.

#include <cstdint>
#include <string>
#include <vector>

#include "harness/ByteReader.h"
#include "harness/Check.h"
#include "harness/Fuzzing.h"
#include "harness/Scratch.h"
#include "harness/TuneCommand.h"

namespace velmora::mobile::xplat::cellar::fuzz {
namespace {

const char* const kConfiguration =
    R"({"m": {"area": "caches", "stores": {"thumbs": {"type": "disk_cache", "lru_size_limit": "1KB"}}}})";

std::vector<std::string> optionsFrom(std::uint8_t byte, const Scratch& scratch) {
  const auto isSet = [byte](unsigned bit) { return ((static_cast<unsigned>(byte) >> bit) & 1U) != 0; };
  std::vector<std::string> options;
  if (isSet(0)) options.emplace_back("--store=thumbs");
  if (isSet(1)) options.emplace_back("--unknown-size=4294967295");
  if (isSet(2)) options.emplace_back("--worth=100");
  if (isSet(3)) {
    options.push_back("--config=" + scratch.write("storage.json", kConfiguration));
    return options;
  }
  if (isSet(4)) options.emplace_back("--limit=3");
  if (isSet(5)) options.emplace_back("--strategy=greedy_dual");
  return options;
}

void run(ByteReader input) {
  const Scratch scratch;
  const std::vector<std::string> options = optionsFrom(input.byte(), scratch);
  checkTune(scratch, input.rest(), options);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::fuzz

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  velmora::mobile::xplat::cellar::fuzz::run({data, size});
  return 0;
}
