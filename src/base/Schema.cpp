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
constexpr const char* kChecksumColumn = "checksum";

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

bool hasChecksumColumn(SQLiteStore& store) {
  const auto columns = store.info(kManifestTable);
  return std::any_of(columns.begin(), columns.end(),
                     [](const SQLiteStoreColumn& column) { return column.name == kChecksumColumn; });
}

void addChecksums(SQLiteStore& store) {
  if (!hasChecksumColumn(store)) store.exec(kAddChecksums);
}

}  // namespace velmora::mobile::xplat::cellar
