#include "tune/TunePlot.h"

#include <algorithm>
#include <array>
#include <cmath>
#include <cstdint>
#include <cstdio>

#include "Format.h"
#include "Markup.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr double kWidth = 800;
constexpr double kHeight = 460;
constexpr double kLeft = 64;
constexpr double kRight = 24;
constexpr double kTop = 76;
constexpr double kBottom = 52;

constexpr const char* kStyle = R"css(
  svg { font: 13px system-ui, sans-serif; --ink: #1f2430; --soft: #6b7280; --rule: #e3e6eb; --paper: #ffffff;
        --hits: #1f6feb; --bytes: #0f9d6b; --video: #b45309; --mark: #c0267a; }
  @media (prefers-color-scheme: dark) {
    svg { --ink: #e6e8ee; --soft: #9aa3b2; --rule: #2c323d; --paper: #14171d;
          --hits: #6ea8fe; --bytes: #4fd1a1; --video: #f0b35a; --mark: #f472b6; } }
  .paper { fill: var(--paper); } text { fill: var(--ink); } .soft { fill: var(--soft); }
  .title { font-size: 17px; font-weight: 600; } .rule { stroke: var(--rule); }
  .line { fill: none; stroke-width: 2; stroke-linejoin: round; }
  .hits { stroke: var(--hits); } .bytes { stroke: var(--bytes); stroke-dasharray: 6 4; }
  .video { stroke: var(--video); stroke-dasharray: 2 3; }
  .mark { stroke: var(--mark); stroke-dasharray: 4 4; } .mark-text { fill: var(--mark); font-size: 12px; }
)css";

std::string number(double value) {
  std::array<char, 32> text{};
  (void)std::snprintf(text.data(), text.size(), "%.1f", value);
  return text.data();
}

double share(std::uint64_t part, std::uint64_t whole) {
  return whole == 0 ? 0 : static_cast<double>(part) / static_cast<double>(whole);
}

class Plot {
 public:
  explicit Plot(const TuneReport& report) : report_(report), tuning_(report.tuning) {
    if (tuning_.curve.empty()) return;
    first_ = std::log2(static_cast<double>(tuning_.curve.front().limit));
    last_ = std::max(first_ + 1, std::log2(static_cast<double>(tuning_.curve.back().limit)));
  }

  std::string draw() {
    svg_ = "<svg xmlns=\"http://www.w3.org/2000/svg\" viewBox=\"0 0 " + number(kWidth) + " " + number(kHeight) +
           "\" role=\"img\">\n<style>" + kStyle + "</style>\n";
    svg_ += "<rect class=\"paper\" width=\"100%\" height=\"100%\"/>\n";
    drawTitle();
    drawRates();
    drawLimits();
    drawCurves();
    drawMarks();
    return svg_ + "</svg>\n";
  }

 private:
  double x(std::int64_t limit) const {
    const double place = (std::log2(static_cast<double>(limit)) - first_) / (last_ - first_);
    return kLeft + std::min(1.0, std::max(0.0, place)) * (kWidth - kLeft - kRight);
  }
  static double y(double rate) { return kHeight - kBottom - rate * (kHeight - kTop - kBottom); }

  void line(const char* kind, double x1, double y1, double x2, double y2) {
    svg_ += std::string("<line class=\"") + kind + "\" x1=\"" + number(x1) + "\" y1=\"" + number(y1) + "\" x2=\"" +
            number(x2) + "\" y2=\"" + number(y2) + "\"/>\n";
  }
  void text(const char* kind, const char* anchor, double left, double base, const std::string& content) {
    svg_ += std::string("<text class=\"") + kind + "\" text-anchor=\"" + anchor + "\" x=\"" + number(left) + "\" y=\"" +
            number(base) + "\">" + escapedMarkup(content) + "</text>\n";
  }

  void drawTitle() {
    text("title", "start", kLeft, 28, "Hit rate by size limit" + (report_.store.empty() ? "" : " of " + report_.store));
    double left = kLeft;
    left = drawKey(left, "hits", "requests");
    left = drawKey(left, "bytes", "bytes");
    if (hasVideo()) drawKey(left, "video", "requests, video strategy");
  }

  double drawKey(double left, const char* kind, const char* content) {
    line((std::string("line ") + kind).c_str(), left, 48, left + 28, 48);
    text("soft", "start", left + 34, 52, content);
    return left + 110;
  }

  void drawRates() {
    for (int percent = 0; percent <= 100; percent += 20) {
      const double height = y(percent / 100.0);
      line("rule", kLeft, height, kWidth - kRight, height);
      text("soft", "end", kLeft - 8, height + 4, std::to_string(percent) + " %");
    }
  }

  // At every power of two, or every so many, so that the texts have room.
  void drawLimits() {
    const int step = std::max(1, static_cast<int>(std::ceil((last_ - first_) / 9)));
    for (int power = static_cast<int>(std::ceil(first_)); power <= last_; power += step) {
      const std::int64_t limit = std::int64_t{1} << power;
      line("rule", x(limit), kTop, x(limit), kHeight - kBottom);
      text("soft", "middle", x(limit), kHeight - kBottom + 20, formatWholeSize(static_cast<std::uint64_t>(limit)));
    }
    text("soft", "end", kWidth - kRight, kHeight - 12,
         "size limit, each rule " + std::to_string(1 << step) + " times the one before");
  }

  void drawCurves() {
    std::string hits;
    std::string bytes;
    for (const HitCurve::Point& point : tuning_.curve) {
      const std::string left = number(x(point.limit)) + ",";
      hits += left + number(y(share(point.hits, tuning_.requests))) + " ";
      bytes += left + number(y(share(point.hitBytes, tuning_.requestedBytes))) + " ";
    }
    drawLine("bytes", bytes);
    drawLine("hits", hits);
    if (!hasVideo()) return;
    std::string video;
    for (const TunedLimit& limit : tuning_.limits) {
      video += number(x(limit.lru.limit)) + "," + number(y(share(*limit.videoHits, tuning_.requests))) + " ";
    }
    drawLine("video", video);
  }

  void drawLine(const char* kind, const std::string& points) {
    svg_ += std::string("<polyline class=\"line ") + kind + "\" points=\"" + points + "\"/>\n";
  }

  void drawMarks() {
    const TunedLimit* const enough = enoughLimit(tuning_);
    const TunedLimit* const present = presentLimit(tuning_);
    if (enough != nullptr) drawMark(*enough, enough == present ? "present, enough" : "enough", kTop + 14);
    if (present != nullptr && present != enough) drawMark(*present, "present", kTop + 30);
  }

  void drawMark(const TunedLimit& limit, const char* what, double base) {
    const double left = x(limit.lru.limit);
    const bool isRight = left > kWidth / 2;
    line("mark", left, kTop, left, kHeight - kBottom);
    text("mark-text", isRight ? "end" : "start", isRight ? left - 6 : left + 6, base,
         std::string(what) + ": " + formatWholeSize(static_cast<std::uint64_t>(limit.lru.limit)) + ", " +
             number(100 * share(limit.lru.hits, tuning_.requests)) + " %");
  }

  bool hasVideo() const { return !tuning_.limits.empty() && tuning_.limits.front().videoHits.has_value(); }

  const TuneReport& report_;
  const Tuning& tuning_;
  double first_ = 0;  // binary logarithms of the limits at both ends
  double last_ = 1;
  std::string svg_;
};

}  // namespace

std::string tuningAsSvg(const TuneReport& report) { return Plot(report).draw(); }

}  // namespace velmora::mobile::xplat::cellar::tools
