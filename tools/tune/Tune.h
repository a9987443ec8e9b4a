#pragma once

namespace CLI {
class App;
}

namespace velmora::mobile::xplat::cellar::tools {

// Adds the command `tune` to the program; when called, it stores its exit status in `status`.
void addTuneCommand(CLI::App& app, int& status);

}  // namespace velmora::mobile::xplat::cellar::tools
