// Files as large as a 32-bit file system call cannot tell, with the C library's own stream functions, which the other
// tests of FileUtils replace.
#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <cstdint>
#include <string>

#include "FileUtils.h"
#include "LarderException.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar {
namespace {

class LargeFile : public testing::Test {
 protected:
  // A file of that size that takes no space.
  std::string make(long long size) const {
    std::string path = directory_.write(std::to_string(size), "");
    EXPECT_EQ(truncate(path.c_str(), size), 0);
    return path;
  }

  test::TemporaryDirectory directory_;
  FileUtils files_;
};

TEST_F(LargeFile, IsListedWithItsExactSizeAtEveryEdge) {
  for (const long long size : {(1LL << 31) - 1, 1LL << 31, (1LL << 32) - 1, 1LL << 32, (1LL << 32) + 5, 1LL << 40}) {
    const std::string path = make(size);
    EXPECT_EQ(files_.listDirectory(directory_.path()).at(0).size, size);
    files_.deleteFile(path);
  }
}

TEST_F(LargeFile, IsAFileLikeOthersForEverythingThatDoesNotReadIt) {
  const std::string path = make((1LL << 32) + 5);
  EXPECT_TRUE(files_.pathExists(path));
  EXPECT_FALSE(files_.isDirectory(path));
  files_.rename(path, directory_.file("renamed"));
  files_.writeFile(directory_.file("renamed"), {1, 2});
  EXPECT_EQ(files_.readFile(directory_.file("renamed")).size(), 2U);
  make(1LL << 32);
  files_.recursiverDirectoryDelete(directory_.path());
  EXPECT_FALSE(files_.pathExists(directory_.path()));
}

// Elsewhere such a file can be read, given the memory.
#if LONG_MAX == INT32_MAX
TEST_F(LargeFile, IsRefusedAndNeverReadInPart) {
  for (const long long size : {1LL << 31, (1LL << 32) - 1, 1LL << 32, (1LL << 32) + 5}) {
    const std::string path = make(size);
    try {
      files_.readFile(path);
      FAIL() << size;
    } catch (const FileUtilsIoException& error) {
      EXPECT_EQ(error.code(), EOVERFLOW) << size;
      EXPECT_STREQ(error.description(), "Could not determine size of file: Value too large for defined data type");
    }
  }
}
#endif

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
