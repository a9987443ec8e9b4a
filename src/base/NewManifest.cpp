#include "base/NewManifest.h"

#include "base/Schema.h"

namespace velmora::mobile::xplat::cellar {

NewManifest::NewManifest(const std::string& path) : store_(path) {
  // Without a log on disk: there is nothing to go back to, and no other file that would have to be renamed with it.
  store_.exec("PRAGMA journal_mode = MEMORY; PRAGMA synchronous = FULL; BEGIN");
  store_.exec(kCreateManifestTable);
  store_.exec(kAddChecksums);
}

void NewManifest::add(const ManifestRow& row) {
  const auto number = [](std::int64_t value) { return static_cast<unsigned long long>(value); };
  SQLiteStoreCursor cursor = store_.cursor(
      "INSERT OR REPLACE INTO LarderManifest(key, filename, size, has_inline_data, modification_date, "
      "last_access_date, inline_data, extended_manifest, checksum) VALUES (?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8, ?9)");
  cursor.bind<std::string>(1, row.item.key);
  cursor.bind<std::string>(2, row.item.filename);
  cursor.bind<unsigned long long>(3, row.item.size);
  cursor.bind<bool>(4, row.item.hasInlineData);
  cursor.bind<unsigned long long>(5, number(row.item.modificationDate));
  cursor.bind<unsigned long long>(6, number(row.item.lastAccessDate));
  if (row.inlineData) cursor.bind<std::vector<unsigned char>>(7, *row.inlineData);
  if (row.metadata) cursor.bind<std::vector<unsigned char>>(8, *row.metadata);
  if (row.item.checksum) cursor.bind<unsigned long long>(9, inChecksumColumn(*row.item.checksum));
  cursor.next();
}

void NewManifest::complete() { store_.exec("COMMIT"); }

}  // namespace velmora::mobile::xplat::cellar
