#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar {

// Whether the file, by whatever path, has a name of the manifest's or the attributes', which no value may have.
bool isReserved(const std::string& filename);

// Throws `std::invalid_argument` for a key that cannot name a file of a store.
void throwIfReserved(const std::string& key);

}  // namespace velmora::mobile::xplat::cellar
