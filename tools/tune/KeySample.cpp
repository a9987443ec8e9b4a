#include "tune/KeySample.h"

#include <charconv>
#include <cmath>
#include <system_error>

#include "InputError.h"

namespace velmora::mobile::xplat::cellar::tools {

KeySample::KeySample(double rate) : rate_(rate), end_(static_cast<std::uint64_t>(std::ceil(std::ldexp(rate, 32)))) {}

std::uint32_t KeySample::hashOf(const std::string& key) {
  std::uint32_t hash = 2166136261U;
  for (const char character : key) hash = (hash ^ static_cast<unsigned char>(character)) * 16777619U;
  hash = (hash ^ (hash >> 15U)) * 739982445U;
  hash = (hash ^ (hash >> 12U)) * 695872825U;
  return hash ^ (hash >> 15U);
}

double parseRate(const std::string& text) {
  const bool isPercent = !text.empty() && text.back() == '%';
  const char* const end = text.data() + text.size() - (isPercent ? 1 : 0);
  double rate = 0;
  const auto [rest, error] = std::from_chars(text.data(), end, rate, std::chars_format::fixed);
  if (isPercent) rate /= 100;
  if (error == std::errc() && rest == end && rate > 0 && rate <= 1) return rate;
  throw InputError("'" + text + "' is not a rate such as 0.01 or 1%, of more than 0 and at most 1");
}

}  // namespace velmora::mobile::xplat::cellar::tools
