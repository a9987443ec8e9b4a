#include "tune/TunePlot.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdint>
#include <cstdio>

#include "Format.h"
#include "Markup.h"
#include "tune/Advice.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr double kLeft = 64;
constexpr double kRight = 776;
constexpr double kTop = 76;
constexpr double kBottom = 408;

constexpr const char* kHead = R"svg(<svg xmlns="http://www.w3.org/2000/svg" viewBox="0 0 800 460" role="img">
<style>
  text { font: 13px sans-serif; fill: #1f2430; } polyline { fill: none; stroke: #1f2430; stroke-width: 2; }
  .paper { fill: #ffffff; } .rule { stroke: #e3e6eb; stroke-width: 1; } .mark { stroke-width: 1; stroke-dasharray: 4 4; }
  @media (prefers-color-scheme: dark) {
    text { fill: #e6e8ee; } polyline { stroke: #e6e8ee; } .paper { fill: #14171d; } .rule { stroke: #2c323d; } }
  .hits { stroke: #3b82f6; } .bytes { stroke: #0f9d6b; stroke-dasharray: 6 4; } .greedy_dual { stroke: #d97706; }
  .video_download { stroke: #b4519f; stroke-dasharray: 2 3; } .foresight { stroke: #8a94a6; stroke-dasharray: 1 3; }
</style>
<rect class="paper" width="800" height="460"/>
)svg";

std::string number(double value) {
  std::array<char, 32> text{};
  (void)std::snprintf(text.data(), text.size(), "%.1f", value);
  return text.data();
}

class Plot {
 public:
  explicit Plot(const Tuning& tuning) : tuning_(tuning) {
    if (tuning.curve.empty()) return;
    first_ = std::log2(static_cast<double>(tuning.curve.front().limit));
    last_ = std::max(first_ + 1, std::log2(static_cast<double>(tuning.curve.back().limit)));
  }

  std::string draw(const std::string& title) {
    text(kLeft, 28, "start", title);
    drawRules();
    drawCurves();
    const Advice advice = adviceOn(tuning_);
    if (!advice.isTooShort) drawMark(advice.limit, advice.strategy, "enough", kTop + 14);
    drawMark(presentLimit(tuning_), tuning_.strategy, "present", kTop + 30);
    return svg_ + "</svg>\n";
  }

 private:
  std::string at(std::int64_t limit, double rate) const { return at(std::log2(static_cast<double>(limit)), rate); }
  std::string at(double power, double rate) const {
    return number(x(power)) + "," + number(kBottom - rate * (kBottom - kTop)) + " ";
  }
  double x(double power) const {
    const double place = (power - first_) / (last_ - first_);
    return kLeft + std::min(1.0, std::max(0.0, place)) * (kRight - kLeft);
  }

  void line(const std::string& kind, const std::string& points) {
    svg_ += "<polyline class=\"" + kind + "\" points=\"" + points + "\"/>\n";
  }
  void text(double left, double base, const std::string& anchor, const std::string& content) {
    svg_ += "<text text-anchor=\"" + anchor + "\" x=\"" + number(left) + "\" y=\"" + number(base) + "\">" +
            escapedMarkup(content) + "</text>\n";
  }

  // Limits at every power of two, or every so many, so that the texts have room.
  void drawRules() {
    for (int percent = 0; percent <= 100; percent += 20) {
      line("rule", at(first_, percent / 100.0) + at(last_, percent / 100.0));
      text(kLeft - 8, kBottom + 4 - percent / 100.0 * (kBottom - kTop), "end", std::to_string(percent) + " %");
    }
    const int step = std::max(1, static_cast<int>(std::ceil((last_ - first_) / 9)));
    for (int power = static_cast<int>(std::ceil(first_)); power <= last_; power += step) {
      line("rule", at(double(power), 0) + at(double(power), 1));
      text(x(power), kBottom + 20, "middle", formatWholeSize(std::uint64_t{1} << power));
    }
  }

  void drawCurves() {
    std::string hits;
    std::string bytes;
    for (const HitCurve::Point& point : tuning_.curve) {
      hits += at(point.limit, share(point.hits, tuning_.requests));
      bytes += at(point.limit, share(point.hitBytes, tuning_.requestedBytes));
    }
    drawCurve("bytes", "lru, bytes", bytes, kLeft + 80);
    drawCurve("hits", "lru", hits, kLeft);
    double left = kLeft + 200;
    for (const std::string& strategy : tuning_.others) {
      std::string points;
      for (const TunedLimit& limit : tuning_.limits) {
        points += at(limit.lru.limit, share(hitsOf(limit, strategy), tuning_.requests));
      }
      drawCurve(strategy, strategy == strategies::kForesight ? "with foresight" : strategy, points, left);
      left += 150;
    }
  }

  void drawCurve(const std::string& kind, const std::string& name, const std::string& points, double left) {
    line(kind, points);
    line(kind, number(left) + ",48 " + number(left + 28) + ",48");
    text(left + 34, 52, "start", name);
  }

  void drawMark(const TunedLimit* limit, const std::string& strategy, const std::string& what, double base) {
    if (limit == nullptr) return;
    const double left = x(std::log2(static_cast<double>(limit->lru.limit)));
    const bool isRight = left > (kLeft + kRight) / 2;
    line("mark", at(limit->lru.limit, 0) + at(limit->lru.limit, 1));
    text(isRight ? left - 6 : left + 6, base, isRight ? "end" : "start",
         what + ": " + formatWholeSize(static_cast<std::uint64_t>(limit->lru.limit)) + ", " +
             number(100 * share(hitsOf(*limit, strategy), tuning_.requests)) + " %");
  }

  const Tuning& tuning_;
  double first_ = 0;  // binary logarithms of the limits at both ends
  double last_ = 1;
  std::string svg_ = kHead;
};

}  // namespace

std::string tuningAsSvg(const TuneReport& report) {
  return Plot(report.tuning).draw("Hit rate by size limit" + (report.store.empty() ? "" : " of " + report.store));
}

}  // namespace velmora::mobile::xplat::cellar::tools
