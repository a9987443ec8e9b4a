#include "Printable.h"

#include <gtest/gtest.h>

#include <sstream>
#include <string>

#include "Console.h"
#include "Markup.h"
#include "Table.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

// What a terminal would act upon: clearing itself, in both codings of the sequence, a new line, an override.
const std::string kHostile =
    "a\x1b[2Jb\xc2\x9b"
    "2Jc\nd\xe2\x80\xae"
    "e\xff";
const std::string kShown = "a\\x1b[2Jb\\u009b2Jc\\x0ad\\u202ee\\xff";

TEST(Printable, KeepsTextOfAllLanguages) {
  for (const char* const text :
       {"", "plain \\ text", "caf\xc3\xa9", "\xd7\xa9\xd7\x9c\xd7\x95\xd7\x9d", "\xe6\x97\xa5\xe6\x9c\xac",
        "\xf0\x9f\x91\xa9\xe2\x80\x8d\xf0\x9f\x9a\x80", "\xd9\x85\xdb\x8c\xe2\x80\x8c\xd8\xae"}) {
    EXPECT_EQ(printable(text), text);
  }
}

TEST(Printable, HasNoControlCharacters) {
  EXPECT_EQ(printable(kHostile), kShown);
  EXPECT_EQ(printable(std::string("\0\t\r\n\x7f", 5)), "\\x00\\x09\\x0d\\x0a\\x7f");
  EXPECT_EQ(printable("\xc2\x80\xc2\x9f\xc2\xa0"), "\\u0080\\u009f\xc2\xa0");
}

TEST(Printable, HasNothingThatChangesTheOrderOrCannotBeSeen) {
  EXPECT_EQ(printable("\xe2\x80\xaa\xe2\x81\xa6\xe2\x81\xa9\xe2\x80\x8e\xd8\x9c"),
            "\\u202a\\u2066\\u2069\\u200e\\u061c");
  EXPECT_EQ(printable("\xe2\x80\xa8\xe2\x80\xa9\xef\xbb\xbf\xe2\x80\x8b"), "\\u2028\\u2029\\ufeff\\u200b");
  EXPECT_EQ(printable("\xf3\xa0\x81\x81"), "\\U000e0041");
}

TEST(Printable, ShowsBytesThatAreNotUtf8) {
  EXPECT_EQ(printable("\x80\xbf"), "\\x80\\xbf");                             // followers without a first byte
  EXPECT_EQ(printable("\xe2\x80"), "\\xe2\\x80");                             // cut off
  EXPECT_EQ(printable("\xe2\x80x"), "\\xe2\\x80x");                           // interrupted
  EXPECT_EQ(printable("\xc0\x9b\xc1\xbf"), "\\xc0\\x9b\\xc1\\xbf");           // longer than needed
  EXPECT_EQ(printable("\xe0\x82\x9b"), "\\xe0\\x82\\x9b");                    // the same
  EXPECT_EQ(printable("\xf0\x80\x82\x9b"), "\\xf0\\x80\\x82\\x9b");           // the same
  EXPECT_EQ(printable("\xed\xa0\x80"), "\\xed\\xa0\\x80");                    // a surrogate
  EXPECT_EQ(printable("\xf4\x90\x80\x80\xf5"), "\\xf4\\x90\\x80\\x80\\xf5");  // beyond the last character
}

TEST(Printable, ChangesNothingTheSecondTime) { EXPECT_EQ(printable(kShown), kShown); }

TEST(Printable, MakesDocumentsOfAscii) {
  const nlohmann::ordered_json document = {{kHostile, "\x7f"}};
  EXPECT_EQ(printable(document, -1), R"({"a\u001b[2Jb\u009b2Jc\nd\u202ee\ufffd":"\u007f"})");
  const nlohmann::ordered_json texts = {{"paths", {"a\xff", "a\xfe", "caf\xc3\xa9"}}};
  EXPECT_EQ(printable(texts, -1), R"({"paths":["a\\xff","a\\xfe","caf\u00e9"]})");
}

TEST(Printable, IsWhatTheConsoleAndTablesShow) {
  std::ostringstream stream;
  Console console(stream, true, true);
  console.line(kHostile, kHostile);
  console.rewriteLine(kHostile);
  EXPECT_EQ(stream.str(), "  " + kShown + "\x1b[2m" + kShown + "\x1b[0m\n\r\x1b[2K" + kShown);
  stream.str("");
  Console plain(stream, false, false);
  plain.heading(kHostile);
  plain.good(kHostile);
  plain.bad(kHostile);
  plain.verdict(kHostile, true);
  EXPECT_EQ(stream.str(), "\n" + kShown + "\n  " + kShown + "\n  " + kShown + "\n\n" + kShown + "\n");
  Table table({{"t", Table::Align::Left}});
  table.addRow({kHostile});
  EXPECT_EQ(table.text(), "  t\n  " + std::string(kShown.size(), '-') + "\n  " + kShown + "\n");
}

TEST(Printable, IsWhatImagesShow) {
  EXPECT_EQ(escapedMarkup("<a href=\"&\">" + kHostile), "&lt;a href=&quot;&amp;&quot;&gt;" + kShown);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
