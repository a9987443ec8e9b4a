#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>

struct sqlite3;

namespace velmora::mobile::xplat::cellar::tools {

// The manifest of a store in its directory, seen by a database connection that shares no code with the library it is
// there to check. To be used while the application is stopped. What fails throws `std::runtime_error`.
class ManifestFile {
 public:
  struct Row {
    std::string filename;
    std::int64_t size;
    bool isInline;
    std::int64_t inlineBytes;
    std::int64_t modificationDate;  // seconds since the Unix epoch
    std::int64_t lastAccessDate;
  };

  explicit ManifestFile(const std::string& storeDirectory);

  std::map<std::string, Row> rowsByKey();

  // Replaces the dates of last access of those keys, all or none.
  void setLastAccessDates(const std::map<std::string, std::int64_t>& dates);

 private:
  void execute(const char* statement);

  const std::shared_ptr<sqlite3> database_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
