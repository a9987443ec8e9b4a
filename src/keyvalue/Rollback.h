#pragma once

#include <exception>
#include <string>

#include "keyvalue/StoreContext.h"
#include "keyvalue/WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

class StoreManifest;
class ValueFiles;
struct FileWrite;

// Takes keys back to what they had before writes that have not come about. A record that cannot be restored is one
// error line.
class Rollback {
 public:
  Rollback(StoreContext& context, StoreManifest& manifest, WritesInFlight& writes, ValueFiles& files)
      : context_(context), manifest_(manifest), writes_(writes), files_(files) {}

  // Ends a write that has failed or was dropped. When no other write of its key is in flight, the key goes back.
  // Takes the mutex.
  void end(FileWrite& write);

  // Ends all writes in flight, none of which will start any more. Purges nothing: the directory may be that of another
  // store by now.
  void endAll(const StoreLock& lock);

  // Takes back the provisional record of a write whose final one could not be written.
  void discardRecord(const StoreLock& lock, const std::string& key, bool othersAreInFlight);

  // Takes back the record of an inline value whose bytes could not be written.
  void tryToRestore(const StoreLock& lock, const std::string& key, const SettledValue& settled);

 private:
  void restore(const std::string& key, const SettledValue& settled);
  void logLostRecord(const std::string& key, const std::exception& error) const;

  StoreContext& context_;
  StoreManifest& manifest_;
  WritesInFlight& writes_;
  ValueFiles& files_;
};

}  // namespace velmora::mobile::xplat::cellar
