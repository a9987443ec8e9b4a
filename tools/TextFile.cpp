#include "TextFile.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <memory>
#include <system_error>

#include "InputError.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

struct CloseFile {
  void operator()(std::FILE* file) const { (void)std::fclose(file); }
};
using File = std::unique_ptr<std::FILE, CloseFile>;

[[noreturn]] void fail(const char* what, const std::string& path, int code) {
  throw InputError(std::string("cannot ") + what + " '" + path + "': " + std::generic_category().message(code));
}

File open(const std::string& path, const char* mode, const char* what) {
  File file(std::fopen(path.c_str(), mode));
  if (file == nullptr) fail(what, path, errno);
  return file;
}

}  // namespace

std::string readTextFile(const std::string& path) {
  const File file = open(path, "rbe", "read");
  std::string text;
  std::array<char, 65536> part{};
  for (;;) {
    const std::size_t count = std::fread(part.data(), 1, part.size(), file.get());
    if (std::ferror(file.get()) != 0) fail("read", path, errno);
    if (count == 0) return text;
    text.append(part.data(), count);
  }
}

void writeTextFile(const std::string& path, const std::string& text) {
  File file = open(path, "wbe", "write");
  const bool written = std::fwrite(text.data(), 1, text.size(), file.get()) == text.size();
  if (!written) fail("write", path, errno);
  if (std::fclose(file.release()) != 0) fail("write", path, errno);
}

void requireOther(const std::string& output, const std::vector<std::string>& others) {
  if (output.empty()) return;
  for (const std::string& other : others) {
    if (!other.empty() && targetOf(output) == targetOf(other)) {
      throw InputError("cannot write '" + output + "': it is given for something else as well");
    }
  }
}

std::string targetOf(const std::string& path) {
  constexpr int mostLinks = 40;  // as many as the system follows
  fs::path target = path;
  std::error_code error;
  for (int links = 0; links < mostLinks && fs::is_symlink(fs::symlink_status(target, error)); ++links) {
    target = target.parent_path() / fs::read_symlink(target, error);
  }
  const fs::path whole = fs::weakly_canonical(target, error);
  return error ? path : whole.string();
}

}  // namespace velmora::mobile::xplat::cellar::tools
