#include "harness/Scratch.h"

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <system_error>

#include "harness/Check.h"

namespace velmora::mobile::xplat::cellar::fuzz {

namespace {

namespace fs = std::filesystem;

// Memory beats a disk by far: most of what is written lives for milliseconds.
fs::path placeForScratch() {
  const char* const inMemory = "/dev/shm";
  const bool chosen = std::getenv("TMPDIR") != nullptr;  // NOLINT(concurrency-mt-unsafe): before any thread starts
  return !chosen && ::access(inMemory, W_OK) == 0 ? fs::path(inMemory) : fs::temp_directory_path();
}

// Made once and only emptied between inputs.
class Place {
 public:
  Place() : path_((placeForScratch() / "cellar-fuzz-XXXXXX").string()) {
    check(::mkdtemp(path_.data()) != nullptr, "a scratch directory can be made", path_);
  }
  Place(const Place&) = delete;
  Place& operator=(const Place&) = delete;
  ~Place() {
    std::error_code ignored;
    fs::remove_all(path_, ignored);
  }

  const std::string& path() const { return path_; }

  void clear() const {
    for (const auto& entry : fs::directory_iterator(path_)) fs::remove_all(entry.path());
  }

 private:
  std::string path_;
};

const Place& place() {
  static const Place only;
  return only;
}

}  // namespace

Scratch::Scratch() { (void)place(); }

Scratch::~Scratch() { place().clear(); }

const std::string& Scratch::path() const { return place().path(); }

std::string Scratch::file(const std::string& name) const { return path() + "/" + name; }

std::string Scratch::write(const std::string& name, const std::string& bytes) const {
  std::ofstream stream(file(name), std::ios::binary | std::ios::trunc);
  stream.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
  stream.close();
  check(static_cast<bool>(stream), "a scratch file can be written", name);
  return file(name);
}

std::string Scratch::read(const std::string& name) const {
  const std::ifstream stream(file(name), std::ios::binary);
  std::ostringstream bytes;
  bytes << stream.rdbuf();
  return bytes.str();
}

std::string Scratch::makeDirectory(const std::string& name) const {
  fs::create_directories(file(name));
  return file(name);
}

}  // namespace velmora::mobile::xplat::cellar::fuzz
