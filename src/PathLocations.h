#pragma once

#include <string>

#include "Export.h"
#include "StoreDefinition.h"

namespace velmora::mobile::xplat::cellar {

// Tells where on this device each area is.
struct CELLAR_EXPORT PathLocations {
  virtual ~PathLocations() = default;

  // The directory in which the managers of that area live; it need not exist yet. The host decides whether the session
  // key plays a part. An exception means that the area is not available now: asking the factory for a manager in it
  // gives none.
  virtual std::string pathForArea(Area area, const std::string& sessionKey) = 0;
};

}  // namespace velmora::mobile::xplat::cellar
