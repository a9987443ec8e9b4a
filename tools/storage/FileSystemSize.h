#pragma once

#include <cstdint>
#include <string>

namespace velmora::mobile::xplat::cellar {
class FileUtils;
}

namespace velmora::mobile::xplat::cellar::tools {

// The size of the whole file system that holds the directory, in bytes. Throws `InputError` when the system does not
// say.
std::int64_t fileSystemSize(const std::string& directory, FileUtils& fileUtils);

// Whether managers empty their directories at each start on a file system of that size, and the sentence that says so.
bool isTooSmall(std::int64_t fileSystemBytes);
std::string tooSmallText(std::int64_t fileSystemBytes);

}  // namespace velmora::mobile::xplat::cellar::tools
