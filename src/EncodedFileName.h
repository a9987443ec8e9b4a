#pragma once

#include <string>

#include "Export.h"

namespace velmora::mobile::xplat::cellar {

// A file name for any bytes: percent-encoded, except a-z, 0-9, "-" and a "." that is not the first character. Different
// bytes give different names, also on file systems that ignore case. No name is "." or "..", contains a "/" or a zero
// byte, or is one that a store reserves for itself. The empty text becomes "%". For keys that you do not control:
//
//   store->fetch(encodeFileName(url));
//
// Throws `std::length_error` when the name would be longer than the 255 bytes that file systems allow: hash such keys
// instead.
CELLAR_EXPORT std::string encodeFileName(const std::string& bytes);

// The bytes that were encoded as this name. Throws `std::invalid_argument` for a name that `encodeFileName` cannot
// return.
CELLAR_EXPORT std::string decodeFileName(const std::string& name);

}  // namespace velmora::mobile::xplat::cellar
