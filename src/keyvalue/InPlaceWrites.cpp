#include "keyvalue/InPlaceWrites.h"

#include <utility>

#include "FileUtils.h"

namespace velmora::mobile::xplat::cellar {

Future<void> InPlaceWrites::store(const std::string& key, const std::vector<unsigned char>& value, Metadata metadata) {
  if (context_.options.inlineData) return inlineWriter_.store(key, value, std::move(metadata));
  auto writeValue = [files = context_.files,
                     copy = std::make_shared<const std::vector<unsigned char>>(value)](const std::string& path) {
    files->writeFile(path, *copy);
    return static_cast<unsigned int>(copy->size());
  };
  return writer_.store(key, std::move(metadata), std::move(writeValue), true);
}

// A host's writer may take its time, or wait for an earlier store.
Future<void> InPlaceWrites::store(const std::string& key, PersistentKeyValueStore::Writer writer, Metadata metadata) {
  return writer_.store(key, std::move(metadata), std::move(writer), false);
}

}  // namespace velmora::mobile::xplat::cellar
