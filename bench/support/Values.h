#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::bench {

using Bytes = std::vector<unsigned char>;

// The key of the n-th item: 24 characters, and like the hashes that name cached things in no order.
std::string keyOf(std::size_t number);

// A value of `size` bytes (at least 8) that does not compress: the number of its item, then noise.
Bytes valueOf(std::size_t size);
void stamp(Bytes& value, std::size_t number);

// Throws unless these are the bytes of the n-th item. The first looks at size and number only, which is quick enough
// to be done while time is taken.
void throwUnlessStamped(const unsigned char* data, std::size_t found, std::size_t size, std::size_t number);
void throwUnlessValue(const Bytes& found, std::size_t size, std::size_t number);

// "100,000"
std::string countName(std::size_t count);

// "4 KiB"
std::string sizeName(std::size_t size);

}  // namespace velmora::mobile::xplat::cellar::bench
