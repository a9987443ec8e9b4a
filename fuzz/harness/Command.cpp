#include "harness/Command.h"

#include <stdlib.h>  // NOLINT(modernize-deprecated-headers): unsetenv is not in the other one

#include <CLI/CLI.hpp>
#include <algorithm>
#include <cstddef>
#include <exception>
#include <iostream>
#include <map>
#include <nlohmann/json.hpp>
#include <sstream>

#include "InputError.h"
#include "Printable.h"
#include "check/Check.h"
#include "harness/Check.h"
#include "inspect/Inspect.h"
#include "page/Page.h"
#include "tune/Tune.h"
#include "verify/Verify.h"

namespace velmora::mobile::xplat::cellar::fuzz {

namespace {

constexpr int kRefused = 2;

// Keeps what is written to a stream.
class Capture {
 public:
  explicit Capture(std::ostream& stream) : stream_(stream), buffer_(stream.rdbuf(text_.rdbuf())) {}
  ~Capture() { (void)stream_.rdbuf(buffer_); }
  Capture(const Capture&) = delete;
  Capture& operator=(const Capture&) = delete;

  std::string text() const { return text_.str(); }

 private:
  std::ostringstream text_;
  std::ostream& stream_;
  std::streambuf* const buffer_;
};

void addCommand(CLI::App& app, const std::string& name, int& status) {
  if (name == "check") tools::addCheckCommand(app, status);
  if (name == "inspect") tools::addInspectCommand(app, status);
  if (name == "tune") tools::addTuneCommand(app, status);
  if (name == "verify") tools::addVerifyCommand(app, status);
}

Outcome parse(std::vector<std::string> arguments) {
  Outcome outcome;
  CLI::App app;
  addCommand(app, arguments.front(), outcome.status);
  std::reverse(arguments.begin(), arguments.end());  // as CLI11 takes them
  try {
    app.parse(std::move(arguments));
  } catch (const CLI::ParseError& error) {
    outcome = {kRefused, error.what(), ""};
  } catch (const tools::InputError& error) {
    outcome = {kRefused, error.what(), ""};
  } catch (const std::exception& error) {
    violated("a command throws nothing but what it refuses its input with", error.what());
  }
  return outcome;
}

bool isName(char c) { return (c >= 'a' && c <= 'z') || c == '/'; }

}  // namespace

Outcome runCommand(const std::vector<std::string>& arguments) {
  (void)unsetenv("TERM");  // NOLINT(concurrency-mt-unsafe): no thread runs between two inputs
  const Capture output(std::cout);
  const Capture errors(std::cerr);
  Outcome outcome = parse(arguments);
  outcome.output = output.text();
  outcome.reason = outcome.reason.empty() ? errors.text() : tools::printable(outcome.reason);
  checkText(outcome.reason);
  return outcome;
}

void checkText(const std::string& text) {
  try {
    (void)nlohmann::json(text).dump();
  } catch (const nlohmann::json::type_error&) {
    violated("a text is UTF-8", text);
  }
  const bool isPlain = std::all_of(text.begin(), text.end(), [](char character) {
    const auto byte = static_cast<unsigned char>(character);
    return (byte >= 0x20 || byte == '\n') && byte != 0x7f;
  });
  check(isPlain, "a text controls nothing", text);
  for (unsigned char byte = 0x80; byte < 0xa0; ++byte) {
    check(text.find({'\xc2', static_cast<char>(byte)}) == std::string::npos, "a text controls nothing", text);
  }
  for (const char* unseen : {"\u061c", "\u200b", "\u200e", "\u200f", "\u2028", "\u2029", "\u202a", "\u202b", "\u202d",
                             "\u202e", "\u2066", "\u2067", "\u2068", "\ufeff"}) {
    check(text.find(unseen) == std::string::npos, "a text says only what can be seen", text);
  }
}

void checkJson(const std::string& text) {
  check(nlohmann::json::accept(text), "JSON can be parsed", text);
  const bool isAscii =
      std::all_of(text.begin(), text.end(), [](char c) { return (c >= ' ' && c < '\x7f') || c == '\n'; });
  check(isAscii, "JSON is ASCII", text);
}

void checkPage(const std::string& text, const char* page) {
  static const std::string mark = "{}";
  static std::map<const char*, std::string> frames;
  std::string& frame = frames[page];
  if (frame.empty()) frame = tools::pageOf(page, mark);
  const std::string element = "id=\"document\">";
  const std::size_t begin = frame.find(element) + element.size();
  const std::size_t behind = frame.size() - begin - mark.size();
  check(text.size() >= begin + behind && text.compare(0, begin, frame, 0, begin) == 0 &&
            text.compare(text.size() - behind, behind, frame, begin + mark.size(), behind) == 0,
        "a page has its document in one place");
  const std::string document = text.substr(begin, text.size() - behind - begin);
  checkJson(document);
  check(document.find('<') == std::string::npos, "a document ends no element of its page", document);
}

void checkSvg(const std::string& text) {
  checkText(text);
  std::vector<std::string> open;
  for (std::size_t place = text.find('<'); place != std::string::npos; place = text.find('<', place)) {
    const std::size_t end = text.find('>', place);
    check(end != std::string::npos && isName(text[place + 1]), "a drawing has elements only", text.substr(place));
    const std::string tag = text.substr(place + 1, end - place - 1);
    place = end;
    if (tag.back() == '/') continue;
    if (tag.front() != '/') {
      open.push_back(tag.substr(0, tag.find_first_of(" \n")));
      continue;
    }
    check(!open.empty() && open.back() == tag.substr(1), "an element is closed where it was opened", text);
    open.pop_back();
  }
  check(open.empty(), "every element is closed", text);
}

}  // namespace velmora::mobile::xplat::cellar::fuzz
