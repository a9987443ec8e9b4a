#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

class Console;

struct DemoOptions {
  std::string directory;  // whose files are used
  std::string root;       // where the stores are; empty: a temporary directory
};

// Plays a day in the life of an application's storage, and checks each scene of it against the file system. True when
// all checks have passed. Throws `InputError` for options that cannot be worked with, before anything is played.
bool runDemo(const DemoOptions& options, Console& console);

}  // namespace velmora::mobile::xplat::cellar::tools
