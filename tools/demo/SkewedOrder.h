#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// Which of `count` things is used when, `length` times in all: few of them often and most of them seldom, the nth most
// popular in proportion to 1/n. Which thing is how popular is drawn, too. The same seed gives the same order
// everywhere. Empty when there are no things.
std::vector<std::size_t> skewedOrder(std::size_t count, std::size_t length, std::uint64_t seed);

}  // namespace velmora::mobile::xplat::cellar::tools
