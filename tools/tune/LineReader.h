#pragma once

#include <cstdint>
#include <cstdio>
#include <memory>
#include <string>

#include "InputError.h"

namespace velmora::mobile::xplat::cellar::tools {

// The lines of a file, or of standard input when its name is "-".
class LineReader {
 public:
  // Throws `InputError`, naming the file and the reason, when it cannot be opened.
  explicit LineReader(const std::string& path);
  ~LineReader();
  LineReader(const LineReader&) = delete;
  LineReader& operator=(const LineReader&) = delete;

  // The next line, without its end; false when there is none. Throws `InputError` when reading fails.
  bool next(std::string& line);

  const std::string& name() const { return name_; }         // for messages
  std::uint64_t lineNumber() const { return lineNumber_; }  // of the last line, from 1
  std::uint64_t bytesRead() const { return bytesRead_; }
  std::uint64_t bytesInAll() const { return bytesInAll_; }  // 0 when that is not known

  // "trace.csv:12: " + text
  [[noreturn]] void fail(const std::string& text) const;

  // What `use` throws of the line gets its place.
  template <class Use> void naming(Use use) const {
    try {
      use();
    } catch (const InputError& error) {
      fail(error.what());
    }
  }

 private:
  struct CloseFile {
    void operator()(std::FILE* file) const;
  };
  struct FreeBuffer {
    void operator()(char* buffer) const;
  };

  const std::string name_;
  std::unique_ptr<std::FILE, CloseFile> file_;
  std::unique_ptr<char, FreeBuffer> buffer_;
  std::size_t bufferSize_ = 0;
  std::uint64_t lineNumber_ = 0;
  std::uint64_t bytesRead_ = 0;
  std::uint64_t bytesInAll_ = 0;
};

}  // namespace velmora::mobile::xplat::cellar::tools
