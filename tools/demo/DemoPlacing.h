#pragma once

#include <string>
#include <vector>

#include "demo/KeyValueClient.h"
#include "demo/SourceFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

// A file that is to be stored, in which store and under which key.
struct Placement {
  std::string store;
  std::string key;
  KeyValueClient::Value value;
};

// Finds a place in the stores with keys for every file: most are thumbnails and chunks of videos as long as they are
// small enough for caches, many are drafts, and some of the smallest are settings. Where there are few files, each is
// placed several times.
std::vector<Placement> placeFiles(const SourceFiles& source);

}  // namespace velmora::mobile::xplat::cellar::tools
