#pragma once

#include <cstdint>
#include <string>

namespace velmora::mobile::xplat::cellar {

class FileUtils;

namespace host {

// The bytes of all files of a tree, links not followed. What vanishes meanwhile does not count. Throws
// `FileUtilsIoException` when a directory cannot be read.
std::uint64_t bytesBelow(FileUtils& fileUtils, const std::string& directory);

}  // namespace host
}  // namespace velmora::mobile::xplat::cellar
