#pragma once

#include <cstdint>
#include <string>

namespace velmora::mobile::xplat::cellar::crash {

// Works on the stores under `root` until the process is killed, and tells of it through the descriptor. Versions count
// on from `firstVersion`. Never returns in the ordinary run of things.
void work(const std::string& root, std::uint64_t seed, std::uint32_t firstVersion, int pipe);

}  // namespace velmora::mobile::xplat::cellar::crash
