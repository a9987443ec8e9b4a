#pragma once

#include <ostream>
#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// The output of a command: plain lines, or a terminal with colours and lines that can be rewritten. Texts are made
// `printable`, but for those of `raw`.
class Console {
 public:
  Console(std::ostream& out, bool isTerminal, bool hasColours);

  // Standard output as it is: colours only on a terminal, and not when NO_COLOR is set.
  static Console standardOutput();

  bool isTerminal() const;

  void heading(const std::string& text);
  void line(const std::string& text, const std::string& dimmed = "");  // indented
  void good(const std::string& text);                                  // indented
  void bad(const std::string& text);                                   // indented
  void raw(const std::string& text);  // unchanged: what is in it must be printable already

  void verdict(const std::string& text, bool isGood);

  // Empties the screen. On terminals only.
  void startAgain();

  // Replaces the line that the cursor is in. On terminals only.
  void rewriteLine(const std::string& text);

 private:
  // Printable, and in the colour.
  std::string coloured(const char* code, const std::string& text) const;

  std::ostream& out_;
  const bool isTerminal_;
  const bool hasColours_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
