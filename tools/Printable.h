#pragma once

#include <nlohmann/json.hpp>
#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// The text as one line that only says what it says: control characters and bytes that are not UTF-8 as "\x1b",
// characters that change the order of the text, break the line or cannot be seen as "\u202e". So a key, a file name or
// a line of a log cannot control a terminal. Applied twice, it changes nothing more.
std::string printable(const std::string& text);

// The document for standard output or a page, all in ASCII, so that it cannot control a terminal either. Bytes that are
// not UTF-8 are shown as "\xff" in its values, so that two paths that differ remain different, and as U+FFFD in its
// names. `indentation` is -1 for a document in one line.
std::string printable(nlohmann::ordered_json document, int indentation);

}  // namespace velmora::mobile::xplat::cellar::tools
