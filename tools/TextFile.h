#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// The bytes of a file. Throws `InputError`, naming the file and the reason, when it cannot be read.
std::string readTextFile(const std::string& path);

// Makes or replaces a file. Throws `InputError`, naming the file and the reason, when it cannot be written.
void writeTextFile(const std::string& path, const std::string& text);

}  // namespace velmora::mobile::xplat::cellar::tools
