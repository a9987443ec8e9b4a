#include "base/Schema.h"

#include <algorithm>
#include <array>
#include <cstddef>
#include <string>
#include <vector>

#include "LarderException.h"
#include "SQLiteStore.h"
#include "base/SchemaFunctions.h"

namespace velmora::mobile::xplat::cellar {

namespace {

constexpr const char* kChooseJournal = "PRAGMA journal_mode = WAL;PRAGMA synchronous = NORMAL;";

struct ExpectedColumn {
  const char* name;
  const char* type;
};

constexpr std::array<ExpectedColumn, 7> kFirstVersionColumns = {{{"key", "TEXT"},
                                                                 {"filename", "TEXT"},
                                                                 {"size", "INTEGER"},
                                                                 {"has_inline_data", "BOOLEAN"},
                                                                 {"inline_data", "BLOB"},
                                                                 {"modification_date", "INTEGER"},
                                                                 {"last_access_date", "INTEGER"}}};
constexpr ExpectedColumn kMetadataColumn = {"extended_manifest", "BLOB"};

void checkColumn(const std::vector<SQLiteStoreColumn>& columns, std::size_t position, const ExpectedColumn& expected) {
  const bool matches =
      position < columns.size() && columns[position].name == expected.name && columns[position].type == expected.type;
  if (!matches) throw SQLiteStoreCorruptedException("Invalid schema.", -1);
}

}  // namespace

void initializeManifestTable(SQLiteStore& store) {
  throwIfTableCallsFunctions(store, kManifestTable);
  store.exec(std::string(kChooseJournal) + kCreateManifestTable);
  const auto columns = store.info(kManifestTable);
  for (std::size_t position = 0; position < kFirstVersionColumns.size(); ++position) {
    checkColumn(columns, position, kFirstVersionColumns[position]);
  }
  if (columns.size() == kFirstVersionColumns.size()) {
    store.exec("ALTER TABLE LarderManifest ADD extended_manifest BLOB");
    return;
  }
  checkColumn(columns, kFirstVersionColumns.size(), kMetadataColumn);
}

std::vector<std::string> columnNamesOf(SQLiteStore& store) {
  SQLiteStoreCursor cursor = store.cursor("PRAGMA table_info(LarderManifest)");
  std::vector<std::string> names;
  while (cursor.next()) names.push_back(cursor.get<std::string>(1));
  return names;
}

bool hasChecksumColumn(SQLiteStore& store) {
  const auto names = columnNamesOf(store);
  return std::find(names.begin(), names.end(), kChecksumColumn) != names.end();
}

bool isToHaveChecksums(SQLiteStore& store) {
  SQLiteStoreCursor cursor = store.cursor("PRAGMA user_version");
  return cursor.next() && cursor.get<unsigned long long>(0) != 0;
}

void addChecksums(SQLiteStore& store) {
  if (hasChecksumColumn(store)) return;
  if (isToHaveChecksums(store)) throw SQLiteStoreCorruptedException("Invalid schema.", -1);
  store.exec("BEGIN IMMEDIATE;" + std::string(kAddChecksums) + "COMMIT;");
}

}  // namespace velmora::mobile::xplat::cellar
