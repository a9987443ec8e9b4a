#pragma once

namespace CLI {
class App;
}

namespace velmora::mobile::xplat::cellar::tools {

// Adds the command `tune` to the program; when it is called it leaves its exit status in `status`.
void addTuneCommand(CLI::App& app, int& status);

}  // namespace velmora::mobile::xplat::cellar::tools
