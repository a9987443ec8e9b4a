#include "host/FileNames.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <cctype>
#include <random>
#include <set>
#include <stdexcept>
#include <string>

#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using std::string;
using test::TemporaryDirectory;

string everyByte() {
  string bytes;
  for (int byte = 0; byte < 256; ++byte) bytes += static_cast<char>(byte);
  return bytes;
}

TEST(EncodingAFileName, LeavesSmallLettersDigitsDashesAndInnerDots) {
  EXPECT_EQ(encodeFileName("abcxyz-0189.jpg..z"), "abcxyz-0189.jpg..z");
}

TEST(EncodingAFileName, WritesEveryOtherByteAsPercentAndTwoDigits) {
  EXPECT_EQ(encodeFileName("http://a/B?c=d_e"), "http%3a%2f%2fa%2f%42%3fc%3dd%5fe");
  EXPECT_EQ(encodeFileName(string("\0\xff%", 3)), "%00%ff%25");
}

TEST(EncodingAFileName, GivesNeverADirectorysOwnNames) {
  EXPECT_EQ(encodeFileName("."), "%2e");
  EXPECT_EQ(encodeFileName(".."), "%2e.");
  EXPECT_EQ(encodeFileName("../../x"), "%2e.%2f..%2fx");
}

TEST(EncodingAFileName, GivesNeverANameThatAStoreReserves) {
  EXPECT_EQ(encodeFileName("manifest_v1.sqlite"), "manifest%5fv1.sqlite");
  EXPECT_EQ(encodeFileName("_cellar_extended_attributes"), "%5fcellar%5fextended%5fattributes");
}

TEST(EncodingAFileName, GivesNothingANameToo) {
  EXPECT_EQ(encodeFileName(""), "%");
  EXPECT_EQ(decodeFileName("%"), "");
}

TEST(EncodingAFileName, StopsAtWhatFileSystemsAllow) {
  EXPECT_EQ(encodeFileName(string(255, 'a')).size(), 255U);
  EXPECT_EQ(encodeFileName(string(85, 'A')).size(), 255U);
  EXPECT_THROW(encodeFileName(string(256, 'a')), std::length_error);
  EXPECT_THROW(encodeFileName(string(86, 'A')), std::length_error);
}

TEST(EncodingAFileName, IsUndoneByDecoding) {
  const string bytes = everyByte();
  for (std::size_t i = 0; i < bytes.size(); i += 32) {
    EXPECT_EQ(decodeFileName(encodeFileName(bytes.substr(i, 32))), bytes.substr(i, 32));
  }
  std::mt19937 random(1);
  for (int run = 0; run < 2000; ++run) {
    string key(random() % 80, '\0');
    for (char& character : key) character = static_cast<char>(random() % 256);
    ASSERT_EQ(decodeFileName(encodeFileName(key)), key) << "run " << run;
  }
}

TEST(EncodingAFileName, KeepsDifferentBytesApartWhereCaseIsIgnored) {
  std::set<string> names;
  for (const char byte : everyByte()) {
    string name = encodeFileName(string(1, byte));
    std::transform(name.begin(), name.end(), name.begin(), [](unsigned char c) { return std::tolower(c); });
    names.insert(name);
  }
  EXPECT_EQ(names.size(), 256U);
}

TEST(EncodingAFileName, GivesNamesThatTheFileSystemTakes) {
  const TemporaryDirectory directory;
  std::set<string> names;
  for (const char byte : everyByte()) names.insert(encodeFileName(string(1, byte)));
  for (const string& name : names) directory.write(name, name);
  EXPECT_EQ(directory.names().size(), 256U);
}

TEST(DecodingAFileName, RefusesWhatEncodingDoesNotMake) {
  for (const string name : {"", ".", "..", "A", "a/b", "%4", "a%", "a%4", "%4G", "%4A", "%61", "%zz", "a_b"}) {
    try {
      decodeFileName(name);
      ADD_FAILURE() << name;
    } catch (const std::invalid_argument& error) {
      EXPECT_EQ(error.what(), "'" + name + "' is not an encoded file name.");
    }
  }
  EXPECT_THROW(decodeFileName(string(256, 'a')), std::invalid_argument);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
