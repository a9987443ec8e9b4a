#pragma once

#include <cstdio>
#include <cstdlib>
#include <string>

namespace velmora::mobile::xplat::cellar::fuzz {

// Ends the process with a message, so that the fuzzer keeps the input.
[[noreturn]] inline void violated(const char* law, const std::string& detail = "") {
  (void)std::fprintf(stderr, "PROPERTY VIOLATED: %s%s%s\n", law, detail.empty() ? "" : ": ", detail.c_str());
  std::abort();
}

inline void check(bool holds, const char* law) {
  if (!holds) violated(law);
}

inline void check(bool holds, const char* law, const std::string& detail) {
  if (!holds) violated(law, detail);
}

}  // namespace velmora::mobile::xplat::cellar::fuzz
