// The schema reader on any text that a table may claim to have been declared by, against a second reading of it; and a
// manifest over such a table, which is refused or works.

#include <algorithm>
#include <cstdint>
#include <filesystem>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "DiskCacheItem.h"
#include "LarderException.h"
#include "SQLiteManifestPersistence.h"
#include "SQLiteStore.h"
#include "harness/ByteReader.h"
#include "harness/Check.h"
#include "harness/Fuzzing.h"
#include "harness/ManifestFile.h"
#include "harness/Scratch.h"

namespace velmora::mobile::xplat::cellar::fuzz {
namespace {

using Columns = std::vector<std::pair<std::string, std::string>>;

const char* const kTable = "LarderManifest";

// --- The second reading ---

bool isSpace(char c) { return c == ' ' || (c >= '\t' && c <= '\r'); }

std::string nextWord(const std::string& text, std::size_t& position) {
  while (position < text.size() && isSpace(text[position])) ++position;
  std::string word;
  while (position < text.size() && !isSpace(text[position])) word.push_back(text[position++]);
  return word;
}

Columns expectedColumns(std::string text) {
  if (text.find(')') != std::string::npos) text.resize(text.find_last_of(')'));
  if (text.find('(') != std::string::npos) text = text.substr(text.find_first_of('(') + 1);
  Columns columns;
  for (std::size_t start = 0; start <= text.size();) {
    const std::size_t comma = std::min(text.find(',', start), text.size());
    const std::string piece = text.substr(start, comma - start);
    start = comma + 1;
    std::size_t position = 0;
    const std::string name = nextWord(piece, position);
    const std::string type = nextWord(piece, position);
    const bool known = type == "INTEGER" || type == "REAL" || type == "TEXT" || type == "BOOLEAN" || type == "BLOB";
    if (known) columns.emplace_back(name, type);
  }
  return columns;
}

// --- The reader under test ---

Columns columnsOf(SQLiteStore& store) {
  Columns columns;
  for (const SQLiteStoreColumn& column : store.info(kTable)) columns.emplace_back(column.name, column.type);
  return columns;
}

std::string quoted(const std::string& text) {
  static const char* const digits = "0123456789abcdef";
  std::string hex;
  for (const char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    hex.push_back(digits[byte / 16]);
    hex.push_back(digits[byte % 16]);
  }
  return "CAST(x'" + hex + "' AS TEXT)";
}

// A store's own connection cannot plant a text. One that has read the declaration before goes on with what it knows, so
// any text at all can be read.
void plantAndRead(const std::string& path, const std::string& text) {
  SQLiteStore store(path);
  store.exec("PRAGMA synchronous = OFF; PRAGMA page_size = 512");
  store.exec(kCurrentTable);
  ManifestFile planter(path);
  check(planter.exec("PRAGMA synchronous = OFF; PRAGMA writable_schema = ON; UPDATE sqlite_master SET sql = " +
                     quoted(text) + " WHERE name = 'LarderManifest'"),
        "any text can be planted", text);
  check(columnsOf(store) == expectedColumns(text), "the columns are those that the text declares", text);
  check(store.info("no such table").empty(), "a table that is not there has no columns");
}

// A new connection believes the text, or takes the file for damaged.
void readAgain(const std::string& path, const std::string& text) {
  try {
    SQLiteStore store(path);
    check(columnsOf(store) == expectedColumns(text), "the columns are those that the text declares", text);
  } catch (const SQLiteStoreException&) {
    // It cannot be parsed.
  }
}

bool hasManifestColumns(const std::string& text) {
  static const Columns manifest = expectedColumns(kCurrentTable);
  const Columns columns = expectedColumns(text);
  return columns.size() >= manifest.size() - 1 &&
         std::equal(manifest.begin(),
                    manifest.begin() + static_cast<std::ptrdiff_t>(std::min(columns.size(), manifest.size())),
                    columns.begin());
}

void useManifest(const std::string& path, const std::string& text) {
  const auto open = [](const std::string& file) { return std::make_unique<SQLiteStore>(file); };
  try {
    SQLiteManifestPersistence manifest(path, nullptr, open);
    check(hasManifestColumns(text), "a table of another form is refused", text);
    (void)manifest.getAllItems();
    manifest.setItem({"key", "key", 7, false, 1, 2, nullptr});
    manifest.setInlineData("key", {1, 2, 3});
    (void)manifest.getItem("key");
    (void)manifest.getInlineData("key");
    (void)manifest.getItemsLastAccessedBefore(100);
    manifest.updateLastAccessDate("key", 3);
    manifest.removeItem("key");
    check(manifest.getItem("key") == nullptr, "what was removed is gone", text);
  } catch (const ManifestPersistenceException&) {
    // The one way to fail: the layers above purge the store and go on.
  }
  for (const char* suffix : {"", "-wal", "-shm", "-journal"}) std::filesystem::remove(path + suffix);
  SQLiteManifestPersistence fresh(path, nullptr, open);
  fresh.setItem({"key", "key", 7, false, 1, 2, nullptr});
  check(fresh.getAllItems().size() == 1, "a manifest that begins again works");
}

void run(const std::string& text) {
  const Scratch scratch;
  const std::string path = scratch.file("manifest_v1.sqlite");
  plantAndRead(path, text);
  readAgain(path, text);
  useManifest(path, text);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::fuzz

int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  using velmora::mobile::xplat::cellar::fuzz::run;
  run(std::string(data, data + size));
  return 0;
}
