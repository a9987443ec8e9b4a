#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar {

class SQLiteStore;

inline constexpr char kManifestTable[] = "LarderManifest";

inline constexpr char kChecksumColumn[] = "checksum";

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

// Adds to it what a safe store keeps beside, and notes in the database's header that it is there: where damage hides
// the column, its values must not pass for unchecked.
inline constexpr char kAddChecksums[] =
    "ALTER TABLE LarderManifest ADD checksum INTEGER;"
    "PRAGMA user_version = 9;";

// Chooses the journal, and brings the table to the latest version or, with SQLiteStoreCorruptedException, refuses it.
void initializeManifestTable(SQLiteStore& store);

// What the column for checksums holds: 2^32 more than the checksum. As SQLite stores numbers, damage to a single bit
// could turn a smaller one to NULL, which is trusted.
constexpr std::uint64_t inChecksumColumn(std::uint32_t checksum) { return (std::uint64_t{1} << 32U) + checksum; }
constexpr std::uint32_t fromChecksumColumn(std::uint64_t number) { return static_cast<std::uint32_t>(number); }

// In their order, whatever their types are.
std::vector<std::string> columnNamesOf(SQLiteStore& store);

bool hasChecksumColumn(SQLiteStore& store);
bool isToHaveChecksums(SQLiteStore& store);  // so the header says

// Unless they are there. Throws SQLiteStoreCorruptedException when they are missing.
void addChecksums(SQLiteStore& store);

}  // namespace velmora::mobile::xplat::cellar
