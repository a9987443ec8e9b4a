#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>

#include "lower_bounds/SQLite.h"

namespace velmora::mobile::xplat::cellar::bench {

// The records of a store on disk, written by hand: the same table by the same statements, each prepared again for each
// operation, and nothing else.
class ManifestLowerBound {
 public:
  explicit ManifestLowerBound(const std::string& directory);

  // Runs `writes` in one transaction. From the first of them on, statements are kept.
  void inTransaction(const std::function<void()>& writes);

  void put(const std::string& key, std::size_t size, std::int32_t date);
  void putValue(const std::string& key, const Bytes& value);  // of a record that is there
  Bytes value(const std::string& key);
  void remove(const std::string& key);

  // Adds the first `count` items, each of so many bytes, in one transaction.
  void fill(std::size_t count, std::size_t size);

  Database& database() { return database_; }

 private:
  Statement& statement(const char* sql);

  Database database_;
  bool keepsStatements_ = false;
  std::map<const char*, std::unique_ptr<Statement>> statements_;
};

// The access date of an item of `fill`: later ones were used later, all of them long ago.
std::int32_t dateOf(std::size_t number);

}  // namespace velmora::mobile::xplat::cellar::bench
