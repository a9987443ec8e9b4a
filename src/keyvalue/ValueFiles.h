#pragma once

#include <optional>
#include <string>
#include <vector>

#include "DiskCacheItem.h"
#include "keyvalue/StoreContext.h"

namespace velmora::mobile::xplat::cellar {

// The files of a store's values.
class ValueFiles {
 public:
  explicit ValueFiles(StoreContext& context) : context_(context) {}

  std::string pathOf(const std::string& filename) const;

  // Where the item's value is; empty when it is not in a file of its own. A record may have any name, an inline store
  // takes any key, and what is not a value must not be deleted as one.
  std::optional<std::string> fileOf(const DiskCacheItem& item) const;

  // Whether a file lies in the key's place.
  bool exists(const std::string& key) const;

  // In a safe store, one that somebody else has deleted is deleted. Throws what deleting it throws.
  void deleteOne(const std::string& path) const;

  // One that cannot be deleted is one error line.
  void deleteAll(const std::vector<std::string>& paths) const;

  // Deletes what an unfinished write has left in the key's place, unless the place may be another store's by now.
  void deleteLeftover(const std::string& key) const;

 private:
  StoreContext& context_;
};

}  // namespace velmora::mobile::xplat::cellar
