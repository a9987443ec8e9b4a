#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar {

class SQLiteStore;

// Throws SQLiteStoreCorruptedException "Invalid schema." (code -1) for a table that calls functions with arguments, or
// that has an index which does: in a check, a default value, a generated column or an indexed expression. SQLite calls
// them whenever a row is written, some take years for a value of their own making, and nothing interrupts them. LIKE
// and GLOB are such functions, too. Not an error: a table that does not exist.
void throwIfTableCallsFunctions(SQLiteStore& store, const std::string& table);

}  // namespace velmora::mobile::xplat::cellar
