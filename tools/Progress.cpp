#include "Progress.h"

#include <algorithm>

#include "Console.h"
#include "Format.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::size_t kBarWidth = 30;
constexpr std::chrono::milliseconds kDrawingInterval(40);
constexpr std::uint64_t kWorthPlainLines = 2000;  // files: fewer are written before anybody wonders

}  // namespace

Progress::Progress(Console& console, std::uint64_t totalFiles)
    : console_(console), totalFiles_(std::max<std::uint64_t>(totalFiles, 1)) {}

Progress::~Progress() {
  if (console_.isTerminal()) console_.rewriteLine("");
}

void Progress::advance(std::uint64_t bytes) {
  ++files_;
  bytes_ += bytes;
  if (console_.isTerminal()) {
    drawBar();
  } else {
    printQuarter();
  }
}

void Progress::drawBar() {
  const auto now = std::chrono::steady_clock::now();
  if (now < nextDrawing_) return;
  nextDrawing_ = now + kDrawingInterval;
  const auto done = static_cast<std::size_t>(std::min<std::uint64_t>(kBarWidth, files_ * kBarWidth / totalFiles_));
  console_.rewriteLine("  [" + std::string(done, '#') + std::string(kBarWidth - done, '.') + "] " + figures());
}

void Progress::printQuarter() {
  if (totalFiles_ < kWorthPlainLines) return;
  const std::uint64_t quarters = files_ * 4 / totalFiles_;
  if (quarters <= quarters_) return;
  quarters_ = quarters;
  console_.line(figures());
}

std::string Progress::figures() const {
  return std::to_string(files_ * 100 / totalFiles_) + " % of " + formatCount(totalFiles_, "file", "files") + ", " +
         formatSize(bytes_);
}

}  // namespace velmora::mobile::xplat::cellar::tools
