// docs/errors.md lists the exceptions that there are.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <regex>
#include <set>
#include <string>
#include <vector>

#include "Future.h"
#include "LarderException.h"
#include "support/Bytes.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using testing::HasSubstr;
using testing::SizeIs;

const std::string kRoot = CELLAR_SOURCE_DIR "/";

using Texts = std::set<std::string>;

std::string read(const std::string& path) {
  std::ifstream file(path, std::ios::binary);
  return {std::istreambuf_iterator<char>(file), std::istreambuf_iterator<char>()};
}

// All sources of the library, or of the kit without that for tests.
std::string sourcesBelow(const std::string& directory) {
  std::string sources;
  for (const auto& entry : std::filesystem::recursive_directory_iterator(kRoot + directory)) {
    const std::string path = entry.path().string();
    const std::string extension = entry.path().extension().string();
    if (path.find("/host/testing/") != std::string::npos || (extension != ".h" && extension != ".cpp")) continue;
    sources += read(path);
  }
  return sources;
}

// Each match, with its groups behind it.
std::vector<std::vector<std::string>> matches(const std::string& text, const std::string& pattern) {
  const std::regex regex(pattern);
  std::vector<std::vector<std::string>> all;
  for (auto match = std::sregex_iterator(text.begin(), text.end(), regex); match != std::sregex_iterator(); ++match) {
    all.emplace_back(match->begin(), match->end());
  }
  return all;
}

// The exported classes that derive from one of these, directly or not.
Texts classesDerivedFrom(Texts roots, const std::string& sources) {
  Texts classes;
  for (std::size_t before = 1; before != classes.size();) {
    before = classes.size();
    for (const auto& match : matches(sources, R"(class CELLAR_EXPORT (\w+) : public ([\w:]+))")) {
      if (roots.count(match[2]) == 0) continue;
      roots.insert(match[1]);
      classes.insert(match[1]);
    }
    if (classes.size() == before) break;
  }
  return classes;
}

// The rows of the table that begins with this cell: all cells by the name in the first.
std::map<std::string, std::vector<std::string>> tableOf(const std::string& section, const std::string& firstCell) {
  std::map<std::string, std::vector<std::string>> rows;
  bool isSection = false;
  bool isTable = false;
  for (const std::string& line : test::linesOf(std::ifstream(kRoot + "docs/errors.md"))) {
    if (line.rfind("## ", 0) == 0) isSection = line == "## " + section;
    isTable = isSection && (line.rfind("| " + firstCell + " |", 0) == 0 || (isTable && line.rfind('|', 0) == 0));
    if (!isTable || line.rfind("| `", 0) != 0) continue;
    std::vector<std::string> cells;
    for (const auto& match : matches(line, R"(\| ([^|]*) (?=\|))")) cells.push_back(match[1]);
    const std::string name = cells.at(0).substr(1, cells.at(0).size() - 2);
    EXPECT_TRUE(rows.emplace(name, cells).second) << name << " is there twice";
    for (const std::string& cell : cells) EXPECT_NE(cell, "") << name;
  }
  return rows;
}

template <class Rows> Texts namesOf(const Rows& rows) {
  Texts names;
  for (const auto& row : rows) names.insert(row.first);
  return names;
}

TEST(ErrorsPage, HasEachExceptionOfTheLibraryAndNoOther) {
  const std::string sources = sourcesBelow("src");
  Texts classes = classesDerivedFrom({"LarderException"}, sources);
  ASSERT_THAT(classes, SizeIs(9));
  classes.insert("LarderException");
  EXPECT_EQ(namesOf(tableOf("Exceptions of the library", "exception")), classes);
}

TEST(ErrorsPage, HasEachExceptionOfTheKitAndNoOther) {
  const Texts roots = {"std::exception",         "std::runtime_error",  "std::logic_error", "std::invalid_argument",
                       "std::nested_exception",  "FutureError",         "LarderException",  "FileUtilsIoException",
                       "ConfigurationException", "InvalidatedException"};
  const Texts classes = classesDerivedFrom(roots, sourcesBelow("host"));
  ASSERT_THAT(classes, SizeIs(6));
  const auto rows = tableOf("Exceptions of the kit", "exception");
  EXPECT_EQ(namesOf(rows), classes);
  for (const auto& [name, cells] : rows) {
    const std::string header = cells.at(1).substr(1, cells.at(1).size() - 2);
    EXPECT_THAT(read(kRoot + header), HasSubstr("class CELLAR_EXPORT " + name + " ")) << header;
  }
}

TEST(ErrorsPage, HasEachDomainAndNoOther) {
  const std::string pattern = R"(QZ\w+Domain)";
  Texts written;
  for (const auto& match : matches(sourcesBelow("src") + sourcesBelow("host"), "\"" + pattern + "\"")) {
    written.insert(match[0].substr(1, match[0].size() - 2));
  }
  Texts listed;
  for (const auto& match : matches(read(kRoot + "docs/errors.md"), pattern)) listed.insert(match[0]);
  ASSERT_THAT(written, SizeIs(7));
  EXPECT_EQ(listed, written);
}

TEST(ErrorsPage, HasTheDomainOfEachException) {
  const auto rows = tableOf("Exceptions of the library", "exception");
  const auto check = [&](const std::string& name, const LarderException& error) {
    EXPECT_EQ(rows.at(name).at(1), std::string("`") + error.domain() + "`") << name;
    EXPECT_EQ(rows.at(name).at(2) == "0", error.code() == 0) << name;
  };
  check("ConfigurationException", ConfigurationException(""));
  check("FileUtilsIoException", FileUtilsIoException(1, ""));
  check("ManifestPersistenceException", ManifestPersistenceException("", 1));
  check("ManifestCorruptedException", ManifestCorruptedException("", 1));
  check("SQLiteStoreException", SQLiteStoreException("", 1));
  check("SQLiteStoreCorruptedException", SQLiteStoreCorruptedException("", 1));
  check("DamagedValueException", DamagedValueException("", ""));
  check("InvalidatedException", InvalidatedException(""));
}

TEST(ErrorsPage, HasEachCodeOfAMisusedFutureWithItsNumber) {
  const std::string header = read(kRoot + "src/Future.h");
  const std::size_t begin = header.find("enum class Code");
  const std::string codes = header.substr(begin, header.find("};", begin) - begin);
  std::map<std::string, std::string> numbers;
  for (const auto& match : matches(codes, R"((\w+) = (\d+),)")) numbers[match[1]] = match[2];
  ASSERT_THAT(numbers, SizeIs(4));
  std::map<std::string, std::string> listed;
  for (const auto& [name, cells] : tableOf("Exceptions of the library", "code")) listed[name] = cells.at(1);
  EXPECT_EQ(listed, numbers);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
