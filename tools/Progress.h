#pragma once

#include <chrono>
#include <cstdint>
#include <string>

namespace velmora::mobile::xplat::cellar::tools {

class Console;

// Progress of what may take longer than a moment: a bar on a terminal, once patience is over, and nothing elsewhere.
class Progress {
 public:
  Progress(Console& console, std::string what, std::chrono::milliseconds patience = std::chrono::seconds(1));

  // Removes the bar.
  ~Progress();
  Progress(const Progress&) = delete;
  Progress& operator=(const Progress&) = delete;

  // Cheap enough for every item of millions. `whole` is 0 when it is not known: then the parts are counted.
  void advanceTo(std::uint64_t part, std::uint64_t whole);

 private:
  void draw(std::uint64_t part, std::uint64_t whole);

  Console& console_;
  const std::string what_;
  std::chrono::steady_clock::time_point nextDrawing_;
  std::uint32_t calls_ = 0;
  bool isDrawn_ = false;
};

}  // namespace velmora::mobile::xplat::cellar::tools
