#pragma once

#include <cellar/FileNames.h>

namespace velmora::mobile::xplat::cellar::host {

using cellar::decodeFileName;
using cellar::encodeFileName;

}  // namespace velmora::mobile::xplat::cellar::host
