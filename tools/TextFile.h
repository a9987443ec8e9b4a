#pragma once

#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// The bytes of a file. Throws `InputError`, naming the file and the reason, when it cannot be read.
std::string readTextFile(const std::string& path);

// Makes or replaces a file. Throws `InputError`, naming the file and the reason, when it cannot be written.
void writeTextFile(const std::string& path, const std::string& text);

// Throws `InputError` if the file that is to be written is one of the others, by whatever name. An empty name is none.
void requireOther(const std::string& output, const std::vector<std::string>& others);

// Where writing to it leads, through links as well, even to what is not there yet.
std::string targetOf(const std::string& path);

}  // namespace velmora::mobile::xplat::cellar::tools
