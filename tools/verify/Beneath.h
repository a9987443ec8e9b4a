#pragma once

#include <sys/types.h>

#include <filesystem>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// A directory below another one, opened without following a link on the way, so that what is created, renamed and
// deleted in it is where it seems to be. Everything throws `std::runtime_error`.
class Beneath {
 public:
  enum class IfMissing { Fail, Create };

  // `below`: relative, without "..". `base` itself is taken as it is.
  Beneath(const std::string& base, const std::filesystem::path& below, IfMissing ifMissing = IfMissing::Fail);
  ~Beneath();
  Beneath(const Beneath&) = delete;
  Beneath& operator=(const Beneath&) = delete;

  // Moves an entry to the first name of its kind that is free in the other directory, "name" or "name.1"; returns that.
  std::string moveTo(const Beneath& target, const std::string& name) const;

  // Writes a new file, of such a name; returns that.
  std::string create(const std::string& name, const std::vector<unsigned char>& bytes) const;

  // Not a directory.
  void remove(const std::string& name) const;

  // Throws unless a file that is to be written in place is a regular one of that directory alone, or missing.
  void requireOwn(const std::string& name) const;

  // The process that has locked the part of a file by which SQLite shows that a database is open; 0 for none.
  pid_t userOfDatabase(const std::string& name) const;

 private:
  void enter(const std::string& name, IfMissing ifMissing);
  [[noreturn]] void fail(const char* what, const std::string& name, int code) const;

  std::string path_;
  int directory_ = -1;
};

}  // namespace velmora::mobile::xplat::cellar::tools
