#include "keyvalue/ReservedKeys.h"

#include <algorithm>
#include <array>
#include <stdexcept>
#include <string_view>

#include "AttributeStore.h"
#include "SQLiteManifestPersistence.h"

namespace velmora::mobile::xplat::cellar {

namespace {

// The names of what lies beside the values. Built on first use: one of them is another file's constant.
const std::array<std::string, 5>& reservedNames() {
  static const std::string manifest(kManifestFileName);
  static const std::array<std::string, 5> names = {manifest, manifest + "-journal", manifest + "-wal",
                                                   manifest + "-shm", AttributeStore::fileName};
  return names;
}

}  // namespace

bool isReserved(const std::string& filename) {
  const std::string_view name = std::string_view(filename).substr(filename.rfind('/') + 1);
  const auto& reserved = reservedNames();
  return std::find(reserved.begin(), reserved.end(), name) != reserved.end();
}

void throwIfReserved(const std::string& key) {
  if (key.find('\0') != std::string::npos) throw std::invalid_argument("Key '" + key + "' holds a zero byte.");
  if (isReserved(key)) throw std::invalid_argument("Key '" + key + "' is reserved.");
}

}  // namespace velmora::mobile::xplat::cellar
