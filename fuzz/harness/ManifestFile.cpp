#include "harness/ManifestFile.h"

#include <sqlite3.h>

#include <algorithm>
#include <fstream>

#include "harness/Check.h"

namespace velmora::mobile::xplat::cellar::fuzz {

const char* const kFirstVersionTable =
    "CREATE TABLE LarderManifest (key TEXT, filename TEXT, size INTEGER, has_inline_data BOOLEAN, inline_data BLOB, "
    "modification_date INTEGER, last_access_date INTEGER, PRIMARY KEY(key))";
const char* const kCurrentTable =
    "CREATE TABLE LarderManifest (key TEXT, filename TEXT, size INTEGER, has_inline_data BOOLEAN, inline_data BLOB, "
    "modification_date INTEGER, last_access_date INTEGER, extended_manifest BLOB, PRIMARY KEY(key))";

namespace {

void bind(sqlite3_stmt* statement, int index, const ManifestFile::Value& value) {
  const auto length = static_cast<int>(value.bytes.size());
  switch (value.type) {
    case 'i':
      (void)sqlite3_bind_int64(statement, index, value.integer);
      break;
    case 'r':
      (void)sqlite3_bind_double(statement, index, static_cast<double>(value.integer) / 3);
      break;
    case 't':
      (void)sqlite3_bind_text(statement, index, value.bytes.data(), length, SQLITE_TRANSIENT);
      break;
    case 'b':
      (void)sqlite3_bind_blob(statement, index, value.bytes.data(), length, SQLITE_TRANSIENT);
      break;
    default:
      (void)sqlite3_bind_null(statement, index);
  }
}

std::string withoutSpaces(std::string text) {
  text.erase(std::remove(text.begin(), text.end(), ' '), text.end());
  return text;
}

}  // namespace

ManifestFile::ManifestFile(const std::string& path) {
  check(sqlite3_open(path.c_str(), &database_) == SQLITE_OK, "a database of the harness opens", path);
}

ManifestFile::~ManifestFile() { (void)sqlite3_close(database_); }

bool ManifestFile::exec(const std::string& sql) {
  return sqlite3_exec(database_, sql.c_str(), nullptr, nullptr, nullptr) == SQLITE_OK;
}

bool ManifestFile::exec(const std::string& sql, const std::vector<Value>& values) {
  sqlite3_stmt* statement = nullptr;
  if (sqlite3_prepare_v2(database_, sql.c_str(), -1, &statement, nullptr) != SQLITE_OK) return false;
  int index = 0;
  for (const Value& value : values) bind(statement, ++index, value);
  const int result = sqlite3_step(statement);
  (void)sqlite3_finalize(statement);
  return result == SQLITE_DONE || result == SQLITE_ROW;
}

std::vector<std::string> ManifestFile::textsOf(const std::string& sql) {
  sqlite3_stmt* statement = nullptr;
  if (sqlite3_prepare_v2(database_, sql.c_str(), -1, &statement, nullptr) != SQLITE_OK) return {};
  std::vector<std::string> texts;
  while (sqlite3_step(statement) == SQLITE_ROW) {
    const void* const bytes = sqlite3_column_blob(statement, 0);
    const auto length = static_cast<std::size_t>(sqlite3_column_bytes(statement, 0));
    texts.push_back(bytes == nullptr ? "" : std::string(static_cast<const char*>(bytes), length));
  }
  (void)sqlite3_finalize(statement);
  return texts;
}

std::optional<std::string> ManifestFile::textOf(const std::string& sql) {
  const std::vector<std::string> texts = textsOf(sql);
  return texts.empty() ? std::nullopt : std::make_optional(texts.front());
}

std::vector<std::string> ManifestFile::filesOfRecords() {
  if (textOf("PRAGMA integrity_check(1)") != "ok") return {};
  return textsOf("SELECT filename FROM LarderManifest WHERE has_inline_data = 0");
}

bool ManifestFile::hasFilesNamedAfterKeys() {
  return textOf("SELECT count(*) FROM LarderManifest WHERE filename IS NOT key") == "0";
}

bool ManifestFile::isSound() {
  if (textOf("PRAGMA integrity_check(1)") != "ok") return false;
  if (textOf("SELECT count(*) FROM sqlite_master WHERE type IN ('trigger', 'view')") != "0") return false;
  if (textOf("SELECT count(*) FROM sqlite_master WHERE name = 'LarderManifest'") != "1") return false;
  // Keys of other types are never found again, and text in another encoding is another text.
  if (textOf("PRAGMA encoding") != "UTF-8") return false;
  if (textOf("SELECT count(*) FROM LarderManifest WHERE typeof(key) != 'text'") != "0") return false;
  // Nothing beside the names and types: a constraint or another collation makes another table of it.
  const std::string sql =
      withoutSpaces(textOf("SELECT sql FROM sqlite_master WHERE name = 'LarderManifest'").value_or(""));
  return sql == withoutSpaces(kFirstVersionTable) || sql == withoutSpaces(kCurrentTable);
}

void copyFile(const std::string& from, const std::string& to) {
  std::ifstream source(from, std::ios::binary);
  std::ofstream copy(to, std::ios::binary);
  if (source.peek() != std::ifstream::traits_type::eof()) copy << source.rdbuf();
  check(copy.good(), "a file can be copied", from);
}

}  // namespace velmora::mobile::xplat::cellar::fuzz
