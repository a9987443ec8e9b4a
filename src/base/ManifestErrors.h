#pragma once

#include "base/FunctionReference.h"

namespace velmora::mobile::xplat::cellar {

// Runs what uses SQLite and throws its exceptions as the manifest's: the layers above know nothing of SQLite.
void translatingManifestErrors(FunctionReference action);

}  // namespace velmora::mobile::xplat::cellar
