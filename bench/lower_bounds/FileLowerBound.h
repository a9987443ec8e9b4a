#pragma once

#include <cstddef>
#include <string>

#include "support/Values.h"

namespace velmora::mobile::xplat::cellar::bench {

// fopen, fwrite or fread, fclose.
void writeFile(const std::string& path, const Bytes& value);
Bytes readFile(const std::string& path, std::size_t size);

}  // namespace velmora::mobile::xplat::cellar::bench
