#pragma once

#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// What the configuration's parser reads. docs/configuration.md describes each of them.
const std::vector<std::string>& keysOfManagers();
const std::vector<std::string>& keysOfStores(const std::string& type);  // those of every store included
const std::vector<std::string>& storeTypes();

// The known key that the reader may have meant: the nearest by changed, added, missing and swapped characters, or empty
// if even that one is too different.
std::string nearestKey(const std::string& key, const std::vector<std::string>& known);

}  // namespace velmora::mobile::xplat::cellar::tools
