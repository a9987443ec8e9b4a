#pragma once

namespace CLI {
class App;
}

namespace velmora::mobile::xplat::cellar::tools {

// Adds the command `check` to the program; when called, it stores its exit status in `status`.
void addCheckCommand(CLI::App& app, int& status);

}  // namespace velmora::mobile::xplat::cellar::tools
