#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// The bytes that were encoded as this file name, as they are; empty if it is not encoded, or reads the same.
std::string decodedName(const std::string& name);

// " (session 'Alice')" for a path below "_store_%41lice"; empty when no session in it is encoded.
std::string sessionNote(const std::string& path);

}  // namespace velmora::mobile::xplat::cellar::tools
