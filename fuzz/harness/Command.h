#pragma once

#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::fuzz {

// How a command of the program `cellar` ended.
struct Outcome {
  int status = 0;      // as the program's: 2 for what it refuses
  std::string reason;  // of the refusal, as a user sees it
  std::string output;
};

// Runs a command in this process, as on a pipe. It may refuse its input; anything else that it throws is a violation.
Outcome runCommand(const std::vector<std::string>& arguments);

// Text for a terminal: UTF-8, of which nothing controls it.
void checkText(const std::string& text);

// One document in ASCII; the text.
void checkJson(const std::string& text);

// A page with such a document in it; `page`: as it is without one.
void checkPage(const std::string& text, const char* page);

// Elements that are closed in order, and nothing that is not escaped.
void checkSvg(const std::string& text);

}  // namespace velmora::mobile::xplat::cellar::fuzz
