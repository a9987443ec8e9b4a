#pragma once

#include <CLI/CLI.hpp>
#include <cmath>
#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// Takes a number from `least` to `most`, and not "nan", which CLI::Range lets through.
inline CLI::Validator numberWithin(double least, double most) {
  const CLI::Range range(least, most);
  const auto whyNot = [range, least](const std::string& text) {
    double number = least;
    const bool isNumber = CLI::detail::lexical_cast(text, number) && !std::isnan(number);
    return isNumber ? range(text) : "'" + text + "' is not a number";
  };
  return {whyNot, ""};
}

}  // namespace velmora::mobile::xplat::cellar::tools
