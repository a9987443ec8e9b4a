#include "Progress.h"

#include <algorithm>
#include <utility>

#include "Console.h"
#include "Format.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::size_t kBarWidth = 30;
constexpr std::chrono::milliseconds kDrawingInterval(100);
constexpr std::uint32_t kCallsBetweenLooksAtTheClock = 64;

}  // namespace

Progress::Progress(Console& console, std::string what, std::chrono::milliseconds patience)
    : console_(console), what_(std::move(what)), nextDrawing_(std::chrono::steady_clock::now() + patience) {}

Progress::~Progress() {
  if (isDrawn_) console_.rewriteLine("");
}

void Progress::advanceTo(std::uint64_t part, std::uint64_t whole) {
  if (!console_.isTerminal() || ++calls_ % kCallsBetweenLooksAtTheClock != 0) return;
  const auto now = std::chrono::steady_clock::now();
  if (now < nextDrawing_) return;
  nextDrawing_ = now + kDrawingInterval;
  draw(part, whole);
}

void Progress::draw(std::uint64_t part, std::uint64_t whole) {
  isDrawn_ = true;
  if (whole == 0) {
    console_.rewriteLine("  " + what_ + ": " + formatCount(part));
    return;
  }
  const auto done = static_cast<std::size_t>(std::min<std::uint64_t>(kBarWidth, part * kBarWidth / whole));
  console_.rewriteLine("  [" + std::string(done, '#') + std::string(kBarWidth - done, '.') + "] " + what_ + ", " +
                       std::to_string(std::min<std::uint64_t>(100, part * 100 / whole)) + " %");
}

}  // namespace velmora::mobile::xplat::cellar::tools
