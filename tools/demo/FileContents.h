#pragma once

#include <cstddef>
#include <vector>

#include "demo/SourceFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

using Bytes = std::vector<unsigned char>;

// The bytes of a file, no more than it had when it was listed: special file systems have files that never end. One that
// has become unreadable or shorter since counts as far as it can be read.
Bytes contentsOf(const SourceFiles::File& file);

// A picture of `bytes` bytes, made by repeating the content of the file, blank when that is empty.
Bytes pictureOf(const SourceFiles::File& file, std::size_t bytes);

}  // namespace velmora::mobile::xplat::cellar::tools
