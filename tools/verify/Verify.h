#pragma once

namespace CLI {
class App;
}

namespace velmora::mobile::xplat::cellar::tools {

// Adds the command `verify` to the program; when called, it stores its exit status in `status`.
void addVerifyCommand(CLI::App& app, int& status);

}  // namespace velmora::mobile::xplat::cellar::tools
