#pragma once

#include "../Export.h"

namespace velmora::mobile::xplat::session {

// Something that holds data of a session and can be notified that the session is over.
class CELLAR_EXPORT Invalidatable {
 public:
  virtual ~Invalidatable() = default;
  virtual void invalidate() = 0;
};

}  // namespace velmora::mobile::xplat::session
