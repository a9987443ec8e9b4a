#pragma once

#include <functional>
#include <string>
#include <vector>

#include "storage/UntouchedFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

// Whether a file of that name (below the store's directory) is the manifest or one of SQLite's files beside it.
bool isManifestFile(const std::string& name);

// Their names.
std::vector<std::string> manifestFiles();

// The manifest that a safe store makes in the place of a damaged one: while it is being made, and while it is complete
// but not in its place.
std::string newManifestName();
std::string salvagedManifestName();

// The directory within a safe store's into which it moves what it cannot use, and whether a file is in it.
extern const char* const kStoreQuarantine;
bool isInStoreQuarantine(const std::string& below);

// Whether it is the file of a directory's attributes.
bool isAttributesFile(const Entry& entry);

// Whether something else has its name: a link, a fifo.
bool isStrangeAttributesFile(const Entry& entry);

using OnEntry = std::function<void(const std::string& below, const Entry&)>;
using OnUnreadable = std::function<void(const Unreadable&)>;

// Every entry of a tree, a directory before its contents, links not followed; each with its path below the tree. Passes
// by directories that cannot be read, or have gone meanwhile, after calling `onUnreadable`.
void walkTree(const std::string& directory, const OnEntry& onEntry, const OnUnreadable& onUnreadable);

// The same for trees that are the program's own: throws `UnreadableException`.
void walkTree(const std::string& directory, const OnEntry& onEntry);

}  // namespace velmora::mobile::xplat::cellar::tools
