// Path functions against their laws: one "/" is the separator, nothing is normalised.

#include <optional>
#include <string>

#include "FileUtils.h"
#include "harness/ByteReader.h"
#include "harness/Check.h"
#include "harness/Fuzzing.h"

namespace velmora::mobile::xplat::cellar::fuzz {
namespace {

// The path without the slashes at its end, of which a first character that is one stays.
std::string withoutTail(std::string path) {
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

// What stands before and behind the last slash; nothing when there is none.
struct Halves {
  std::string before;
  std::string behind;
};

std::optional<Halves> halvesOf(const std::string& path) {
  std::string behind;
  for (std::string before = withoutTail(path); !before.empty(); before.pop_back()) {
    if (before.back() == '/') {
      before.pop_back();
      return Halves{before, behind};
    }
    behind.insert(behind.begin(), before.back());
  }
  return std::nullopt;
}

std::string expectedCombination(const std::string& a, const std::string& b) {
  std::string combined = a;
  if (!a.empty() && a[a.size() - 1] != '/') combined.push_back('/');
  return combined.append(b);
}

void checkParts(FileUtils& files, const std::string& path) {
  const auto halves = halvesOf(path);
  check(files.basename(path) == (halves ? halves->behind : path), "basename is what its law says", path);
  check(files.parentPath(path) == (halves ? halves->before : ""), "parentPath is what its law says", path);
  check(files.parentPath(path).size() <= path.size(), "a parent is no longer than its child", path);
  check(path.empty() || files.parentPath(path) != path, "going to the parent comes to an end", path);
}

void checkCombination(FileUtils& files, const std::string& a, const std::string& b) {
  const std::string combined = files.combinePath(a, b);
  check(combined == expectedCombination(a, b), "combinePath is what its law says", a + " and " + b);
  if (a.empty() || b.empty() || b.find('/') != std::string::npos) return;
  check(files.basename(combined) == b, "a component that was added is the basename", combined);
  const std::string parent = a.back() == '/' ? a.substr(0, a.size() - 1) : a;
  check(files.parentPath(combined) == parent, "what a component was added to is the parent", combined);
}

void run(ByteReader input) {
  FileUtils files;
  const std::string a = input.text();
  const std::string b = input.rest();
  for (const std::string& path : {a, b, a + b}) checkParts(files, path);
  checkCombination(files, a, b);
  checkCombination(files, b, a);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::fuzz

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  velmora::mobile::xplat::cellar::fuzz::run({data, size});
  return 0;
}
