#pragma once

#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

struct sqlite3;

namespace velmora::mobile::xplat::cellar::fuzz {

// The table as the first and as the current version of the manifest declare it.
extern const char* const kFirstVersionTable;
extern const char* const kCurrentTable;

// Piece by piece: as one system call, the fuzzer's own timer may interrupt it.
void copyFile(const std::string& from, const std::string& to);

// A database file, by a connection of the harness's own: it knows nothing of the classes under test, and answers for
// any bytes at all. The connection is closed by the destructor.
class ManifestFile {
 public:
  explicit ManifestFile(const std::string& path);
  ~ManifestFile();
  ManifestFile(const ManifestFile&) = delete;
  ManifestFile& operator=(const ManifestFile&) = delete;

  // False when some statement fails.
  bool exec(const std::string& sql);

  // Puts a value of a chosen SQLite type in place of ?1 to ?n.
  struct Value {
    char type;  // 'i' integer, 'r' real, 't' text, 'b' bytes; anything else is NULL
    long long integer;
    std::string bytes;
  };
  bool exec(const std::string& sql, const std::vector<Value>& values);

  // Whether SQLite finds nothing wrong with the file, and it has the manifest's table with keys that can be found
  // again.
  bool isSound();

  // Whether each record names the file that a store writes for its key.
  bool hasFilesNamedAfterKeys();

  // The names in the records of values in files; none if SQLite finds something wrong with the file.
  std::vector<std::string> filesOfRecords();

 private:
  std::vector<std::string> textsOf(const std::string& sql);
  std::optional<std::string> textOf(const std::string& sql);

  sqlite3* database_ = nullptr;
};

}  // namespace velmora::mobile::xplat::cellar::fuzz
