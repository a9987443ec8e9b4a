#include "Console.h"

#include <unistd.h>

#include <cstdlib>
#include <iostream>

#include "Printable.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr const char* kBold = "1";
constexpr const char* kDim = "2";
constexpr const char* kRed = "1;31";
constexpr const char* kGreen = "32";
constexpr const char* kBoldGreen = "1;32";

std::string environment(const char* name) {
  const char* const value = std::getenv(name);  // NOLINT(concurrency-mt-unsafe): read before any thread is started
  return value == nullptr ? "" : value;
}

}  // namespace

Console::Console(std::ostream& out, bool isTerminal, bool hasColours)
    : out_(out), isTerminal_(isTerminal), hasColours_(hasColours) {}

Console Console::standardOutput() {
  const std::string kind = environment("TERM");
  const bool isTerminal = isatty(STDOUT_FILENO) == 1 && !kind.empty() && kind != "dumb";
  return Console(std::cout, isTerminal, isTerminal && environment("NO_COLOR").empty());
}

bool Console::isTerminal() const { return isTerminal_; }

void Console::heading(const std::string& text) { out_ << "\n" << coloured(kBold, text) << std::endl; }

void Console::line(const std::string& text, const std::string& dimmed) {
  out_ << "  " << printable(text) << (dimmed.empty() ? "" : coloured(kDim, dimmed)) << std::endl;
}

void Console::good(const std::string& text) { out_ << "  " << coloured(kGreen, text) << std::endl; }

void Console::bad(const std::string& text) { out_ << "  " << coloured(kRed, text) << std::endl; }

void Console::raw(const std::string& text) { out_ << text << std::flush; }

void Console::verdict(const std::string& text, bool isGood) {
  out_ << "\n" << coloured(isGood ? kBoldGreen : kRed, text) << std::endl;
}

void Console::startAgain() {
  if (isTerminal_) out_ << "\x1b[H\x1b[2J" << std::flush;
}

void Console::rewriteLine(const std::string& text) { out_ << "\r\x1b[2K" << printable(text) << std::flush; }

std::string Console::coloured(const char* code, const std::string& text) const {
  if (!hasColours_) return printable(text);
  return "\x1b[" + std::string(code) + "m" + printable(text) + "\x1b[0m";
}

}  // namespace velmora::mobile::xplat::cellar::tools
