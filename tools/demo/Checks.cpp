#include "demo/Checks.h"

#include "Console.h"

namespace velmora::mobile::xplat::cellar::tools {

Checks::Checks(Console& console) : console_(console) {}

void Checks::equal(const std::string& what, std::uint64_t expected, std::uint64_t seen) {
  if (expected == seen) return pass();
  fail(what, std::to_string(expected), std::to_string(seen));
}

void Checks::equal(const std::string& what, const std::string& expected, const std::string& seen) {
  if (expected == seen) return pass();
  fail(what, expected, seen);
}

void Checks::isTrue(const std::string& what, bool seen) {
  if (seen) return pass();
  fail(what, "yes", "no");
}

std::size_t Checks::passed() const { return passed_; }
std::size_t Checks::failed() const { return failed_; }

void Checks::pass() { ++passed_; }

void Checks::fail(const std::string& what, const std::string& expected, const std::string& seen) {
  ++failed_;
  console_.bad("FAILED " + what + ": expected " + expected + ", seen " + seen);
}

}  // namespace velmora::mobile::xplat::cellar::tools
