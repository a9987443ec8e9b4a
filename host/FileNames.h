#pragma once

#include <string>

#include <cellar/Export.h>

namespace velmora::mobile::xplat::cellar::host {

// A file name for any bytes: percent-encoded, except a-z, 0-9, "-" and a "." that is not the first character. Different
// bytes give different names, on file systems that ignore case too; no name is "." or "..", holds a "/" or a zero byte,
// or is one that a store reserves for itself. No bytes at all become "%". For keys that are not under your own control:
//
//   store->fetch(host::encodeFileName(url));
//
// Throws `std::length_error` when the name would be longer than the 255 bytes that file systems allow: hash such keys
// instead.
CELLAR_EXPORT std::string encodeFileName(const std::string& bytes);

// The bytes that the name was made of. Throws `std::invalid_argument` for a name that `encodeFileName` does not make.
CELLAR_EXPORT std::string decodeFileName(const std::string& name);

}  // namespace velmora::mobile::xplat::cellar::host
