#pragma once

#include <memory>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::host {
class RootLock;
}

namespace velmora::mobile::xplat::cellar::tools {

// The locks of the hosts to which a directory belongs, held as long as this object lives. They lie in the directory, or
// in one of those above it up to the root of a store of an account.
class HostLocks {
 public:
  // Takes all that are there, and creates none: a host without a lock has none. Throws `InputError` when one cannot be
  // taken, with the process that holds it.
  explicit HostLocks(const std::string& directory);
  ~HostLocks();
  HostLocks(const HostLocks&) = delete;
  HostLocks& operator=(const HostLocks&) = delete;

  bool areThere() const { return !locks_.empty(); }

 private:
  std::vector<std::unique_ptr<const host::RootLock>> locks_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
