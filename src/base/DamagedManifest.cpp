#include "base/DamagedManifest.h"

#include <algorithm>
#include <array>
#include <cstddef>
#include <cstdint>
#include <exception>
#include <limits>
#include <memory>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "LarderException.h"
#include "SQLiteStore.h"
#include "base/Schema.h"
#include "base/SchemaFunctions.h"

namespace velmora::mobile::xplat::cellar {

namespace {

using Bytes = std::vector<unsigned char>;

// SQLite's codes for a statement that names what is not there, and for a value that is larger than any can be.
constexpr int kStatementDoesNotFit = 1;
constexpr int kTooBig = 18;

bool isDamage(const SQLiteStoreException& error) {
  return dynamic_cast<const SQLiteStoreCorruptedException*>(&error) != nullptr ||
         error.code() == kStatementDoesNotFit || error.code() == kTooBig;
}

std::optional<Bytes> bytesIn(SQLiteStoreCursor& cursor, int column, bool isNull) {
  return isNull ? std::nullopt : std::make_optional(cursor.get<Bytes>(column));
}

ManifestRow rowIn(SQLiteStoreCursor& cursor) {
  ManifestRow row;
  row.item.key = cursor.get<std::string>(1);
  row.item.filename = cursor.get<std::string>(2);
  row.item.size = static_cast<std::uint32_t>(cursor.get<unsigned long long>(3));
  row.item.hasInlineData = cursor.get<bool>(4);
  row.item.modificationDate = static_cast<std::int32_t>(cursor.get<unsigned long long>(5));
  row.item.lastAccessDate = static_cast<std::int32_t>(cursor.get<unsigned long long>(6));
  row.inlineData = bytesIn(cursor, 7, !cursor.get<bool>(10));
  row.metadata = bytesIn(cursor, 8, !cursor.get<bool>(11));
  if (cursor.get<bool>(12)) row.item.checksum = fromChecksumColumn(cursor.get<unsigned long long>(9));
  return row;
}

// By their places, because their names may be damaged. NULL where the table has none.
class ColumnNames {
 public:
  explicit ColumnNames(SQLiteStore& store)
      : names_(columnNamesOf(store)), hasChecksums_(hasChecksumColumn(store) || isToHaveChecksums(store)) {}

  std::string at(std::size_t place) const { return place < names_.size() ? quoted(names_[place]) : "NULL"; }

  // By its name first: somebody else's columns may stand before it.
  std::string checksum() const {
    if (!hasChecksums_) return "NULL";
    const bool isNamed = std::find(names_.begin(), names_.end(), kChecksumColumn) != names_.end();
    return isNamed ? kChecksumColumn : at(kPlaceOfChecksum);
  }

 private:
  static constexpr std::size_t kPlaceOfChecksum = 8;

  static std::string quoted(const std::string& name) {
    std::string quoted = "\"";
    for (const char character : name) quoted += character == '"' ? std::string("\"\"") : std::string(1, character);
    return quoted + "\"";
  }

  const std::vector<std::string> names_;
  const bool hasChecksums_;
};

std::string selectRowsOf(const ColumnNames& columns) {
  std::string statement = "SELECT rowid";
  for (const std::size_t place : std::array<std::size_t, 6>{0, 1, 2, 3, 5, 6}) statement += ", " + columns.at(place);
  const std::array<std::string, 3> mayBeNull = {columns.at(4), columns.at(7), columns.checksum()};
  for (const std::string& name : mayBeNull) statement += ", " + name;
  for (const std::string& name : mayBeNull) statement += ", " + name + " IS NOT NULL";
  return statement + " FROM LarderManifest WHERE rowid >= ?1 ORDER BY rowid";
}

// What the consumer of a row has thrown, which is no damage.
struct ConsumerFailure {
  std::exception_ptr failure;
};

class Reading {
 public:
  Reading(SQLiteStore& store, const std::function<void(ManifestRow&&)>& consume)
      : store_(store), selectRows_(selectRowsOf(ColumnNames(store))), consume_(consume) {}

  void readAll() {
    for (bool isOver = false; !isOver;) {
      try {
        readOn();
        isOver = true;
      } catch (const SQLiteStoreException& error) {
        if (!isDamage(error)) throw;
        isOver = !skipDamage();
      }
    }
  }

 private:
  static constexpr std::int64_t kFirstRow = std::numeric_limits<std::int64_t>::min();
  static constexpr std::int64_t kLastRow = std::numeric_limits<std::int64_t>::max();

  // From the row that is next up to the first that cannot be read.
  void readOn() {
    SQLiteStoreCursor cursor = store_.cursor(selectRows_);
    bindRow(cursor, next_);
    while (cursor.next()) {
      const auto number = static_cast<std::int64_t>(cursor.get<unsigned long long>(0));
      if (number == kLastRow) return;
      if (number >= next_) {  // a damaged number may be followed by a smaller one
        next_ = number + 1;
        firstDistance_ = 1;
      }
      consume(rowIn(cursor));
    }
  }

  void consume(ManifestRow&& row) {
    try {
      consume_(std::move(row));
    } catch (...) {
      throw ConsumerFailure{std::current_exception()};
    }
  }

  // A damaged page takes a range of rows with it: finds its end, doubling the distance and then halving it. False when
  // there is none.
  bool skipDamage() {
    if (firstDistance_ == 1 && canRead(next_)) {  // the damage was in the last row
      firstDistance_ = 2;
      return true;
    }
    std::int64_t damaged = next_;
    std::int64_t distance = firstDistance_;
    while (damaged < kLastRow - distance && !canRead(damaged + distance)) {
      damaged += distance;
      distance = doubled(distance);
    }
    if (damaged >= kLastRow - distance) return false;
    std::int64_t readable = damaged + distance;
    while (readable - damaged > firstDistance_) {
      const std::int64_t middle = damaged + (readable - damaged) / 2;
      (canRead(middle) ? readable : damaged) = middle;
    }
    next_ = readable;
    firstDistance_ = doubled(firstDistance_);
    return true;
  }

  static std::int64_t doubled(std::int64_t distance) { return distance < kLastRow / 4 ? 2 * distance : distance; }

  // The first of the rows from this one on, whole.
  bool canRead(std::int64_t row) {
    try {
      SQLiteStoreCursor cursor = store_.cursor(selectRows_ + " LIMIT 1");
      bindRow(cursor, row);
      if (cursor.next()) rowIn(cursor);
      return true;
    } catch (const SQLiteStoreException& error) {
      if (!isDamage(error)) throw;
      return false;
    }
  }

  static void bindRow(SQLiteStoreCursor& cursor, std::int64_t row) {
    cursor.bind<unsigned long long>(1, static_cast<unsigned long long>(row));
  }

  SQLiteStore& store_;
  const std::string selectRows_;
  const std::function<void(ManifestRow&&)>& consume_;
  std::int64_t next_ = kFirstRow;   // a damaged number may be negative
  std::int64_t firstDistance_ = 1;  // grows while damage follows damage, so that this ends
};

}  // namespace

void readDamagedManifest(const std::string& path, const std::function<void(ManifestRow&&)>& consume) {
  try {
    SQLiteStore store(path);
    throwIfTableCallsFunctions(store, kManifestTable);
    Reading(store, consume).readAll();
  } catch (const ConsumerFailure& error) {
    std::rethrow_exception(error.failure);
  } catch (const SQLiteStoreException& error) {
    if (!isDamage(error)) throw;
  }
}

}  // namespace velmora::mobile::xplat::cellar
