#pragma once

#include <cellar/EncodedFileName.h>

namespace velmora::mobile::xplat::cellar::host {

using cellar::decodeFileName;
using cellar::encodeFileName;

}  // namespace velmora::mobile::xplat::cellar::host
