#pragma once

#include <cstddef>
#include <cstdint>
#include <string>

#include "inspect/Survey.h"
#include "storage/StoreFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

struct ConfiguredStore;
struct StorePlace;

// What is needed for the figures of a store.
struct StoreContext {
  std::string root;
  std::string temporaryDirectory;  // for the copy of a manifest
  std::size_t top;
  std::int64_t now;
  OnFile onFile;
  OnUnreadable onUnreadable;
  bool hashesKeys;
};

// The figures of one store's directory. What cannot be read is not in them.
StoreSurvey surveyStore(const StorePlace& place, const ConfiguredStore& configured, const StoreContext& context);

// The files of a tree that is not a store.
void measureTree(const std::string& path, Leftover& leftover, const StoreContext& context);

}  // namespace velmora::mobile::xplat::cellar::tools
