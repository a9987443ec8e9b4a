#include "Format.h"

#include <array>
#include <cstdio>

namespace velmora::mobile::xplat::cellar::tools {

namespace {

std::string withOneDecimal(double value, const char* unit) {
  std::array<char, 64> text{};
  (void)std::snprintf(text.data(), text.size(), "%.1f %s", value, unit);
  return text.data();
}

}  // namespace

std::string formatSize(std::uint64_t bytes) {
  constexpr double kilo = 1024;
  const auto size = static_cast<double>(bytes);
  if (size < kilo) return std::to_string(bytes) + " B";
  if (size < kilo * kilo) return withOneDecimal(size / kilo, "KB");
  if (size < kilo * kilo * kilo) return withOneDecimal(size / (kilo * kilo), "MB");
  return withOneDecimal(size / (kilo * kilo * kilo), "GB");
}

std::string formatWholeSize(std::uint64_t bytes) {
  std::uint64_t number = bytes;
  std::size_t unit = 0;
  static constexpr const char* units[] = {" B", " KB", " MB", " GB"};
  while (unit < 3 && number != 0 && number % 1024 == 0) {
    number /= 1024;
    ++unit;
  }
  return std::to_string(number) + units[unit];
}

std::string formatCount(std::uint64_t count) {
  std::string text = std::to_string(count);
  for (std::size_t end = text.size(); end > 3; end -= 3) text.insert(end - 3, ",");
  return text;
}

std::string formatCount(std::uint64_t count, const std::string& singular, const std::string& plural) {
  return formatCount(count) + " " + (count == 1 ? singular : plural);
}

std::string formatTime(std::chrono::nanoseconds duration) {
  const double milliseconds = std::chrono::duration<double, std::milli>(duration).count();
  if (milliseconds < 10) return withOneDecimal(milliseconds, "ms");
  if (milliseconds < 1000) return std::to_string(static_cast<int>(milliseconds)) + " ms";
  return withOneDecimal(milliseconds / 1000, "s");
}

std::string formatDuration(std::uint64_t seconds) {
  struct Unit {
    std::uint64_t seconds;
    const char* singular;
    const char* plural;
  };
  static constexpr Unit units[] = {{std::uint64_t{365} * 86400, "year", "years"},
                                   {86400, "day", "days"},
                                   {3600, "hour", "hours"},
                                   {60, "minute", "minutes"},
                                   {1, "second", "seconds"}};
  std::string text;
  for (const Unit& unit : units) {
    const std::uint64_t count = seconds / unit.seconds;
    seconds %= unit.seconds;
    if (count > 0) text += (text.empty() ? "" : " ") + formatCount(count, unit.singular, unit.plural);
  }
  return text.empty() ? "0 seconds" : text;
}

std::string formatFiles(const TreeSize& size) {
  return formatCount(size.files, "file", "files") + ", " + formatSize(size.bytes);
}

}  // namespace velmora::mobile::xplat::cellar::tools
