#pragma once

#include <functional>
#include <string>

#include "base/ManifestRow.h"

namespace velmora::mobile::xplat::cellar {

// Calls `consume` with each row that can be read of the damaged manifest at `path`, in the order in which they were
// written; a key may come twice, its latest row last. What cannot be read is passed over, and may be everything. Throws
// `SQLiteStoreException` when the file cannot be read at the moment: then it is not known what can be read of it.
void readDamagedManifest(const std::string& path, const std::function<void(ManifestRow&&)>& consume);

}  // namespace velmora::mobile::xplat::cellar
