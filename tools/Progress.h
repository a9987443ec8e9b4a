#pragma once

#include <chrono>
#include <cstdint>
#include <string>

namespace velmora::mobile::xplat::cellar::tools {

class Console;

// How far copying files has come: a bar that moves on a terminal, and elsewhere, when there
// are many, a plain line for every quarter.
class Progress {
 public:
  Progress(Console& console, std::uint64_t totalFiles);

  // Leaves no half-drawn bar behind.
  ~Progress();
  Progress(const Progress&) = delete;
  Progress& operator=(const Progress&) = delete;

  void advance(std::uint64_t bytes);  // by one file

 private:
  void drawBar();
  void printQuarter();
  std::string figures() const;

  Console& console_;
  const std::uint64_t totalFiles_;
  std::uint64_t files_ = 0;
  std::uint64_t bytes_ = 0;
  std::uint64_t quarters_ = 0;
  std::chrono::steady_clock::time_point nextDrawing_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
