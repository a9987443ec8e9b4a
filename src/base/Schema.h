#pragma once

namespace velmora::mobile::xplat::cellar {

class SQLiteStore;

inline constexpr char kManifestTable[] = "LarderManifest";

// Makes the table unless it is there.
inline constexpr char kCreateManifestTable[] =
    "CREATE TABLE IF NOT EXISTS LarderManifest ("
    "key               TEXT,   "
    "filename          TEXT,   "
    "size              INTEGER,   "
    "has_inline_data   BOOLEAN,   "
    "inline_data       BLOB,   "
    "modification_date INTEGER,   "
    "last_access_date  INTEGER,   "
    "extended_manifest BLOB,   "
    "PRIMARY KEY(key));"
    "CREATE INDEX IF NOT EXISTS last_access_date_idx   ON LarderManifest(last_access_date);";

// Adds to it what a safe store keeps beside.
inline constexpr char kAddChecksums[] = "ALTER TABLE LarderManifest ADD checksum INTEGER";

// Chooses the journal, and brings the table to the latest version or, with SQLiteStoreCorruptedException, refuses it.
void initializeManifestTable(SQLiteStore& store);

bool hasChecksumColumn(SQLiteStore& store);
void addChecksums(SQLiteStore& store);  // unless they are there

}  // namespace velmora::mobile::xplat::cellar
