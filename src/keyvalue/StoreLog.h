#pragma once

#include <glog/logging.h>

namespace velmora::mobile::xplat::cellar {

// A line of the error log: `errorLine(__LINE__).stream() << text`. It carries the name of the class that hosts know,
// whichever of its parts writes it.
inline google::LogMessage errorLine(int line) {
  return google::LogMessage("PersistentKeyValueStore.cpp", line, google::GLOG_ERROR);
}

}  // namespace velmora::mobile::xplat::cellar
