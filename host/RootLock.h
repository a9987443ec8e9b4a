#pragma once

#include <sys/types.h>

#include <memory>
#include <string>

#include <cellar/Export.h>

namespace velmora::mobile::xplat::cellar::host {

// Keeps a directory of storage to one user at a time: two hosts in one root do not know of each other's writes and lose
// values. An advisory lock (`flock`) on the file "_cellar_lock" in the directory, which holds the process id of its
// owner and stays behind when the lock is released. For those who build a host of their own; `Host` has one.
//
// The lock belongs to this object, not to the process: a second one is refused in the same process too. The system
// releases it when the process ends in whatever way. A child process inherits it by fork, not by exec: should the owner
// be killed, such a child keeps the directory locked until it ends.
class CELLAR_EXPORT RootLock {
 public:
  static const std::string fileName;  // "_cellar_lock"

  // Takes the lock, or fails at once. Throws `FileUtilsIoException`: code `EWOULDBLOCK` when somebody else has it, with
  // the directory and the owner's process id in the text; else the code of what failed, on a file system without locks
  // say, or 0 when something that is not a regular file has the file's name. Links are not followed. The directory must
  // exist.
  explicit RootLock(const std::string& root);

  // Releases the lock, in the process that took it: in a child, the parent keeps it.
  ~RootLock();

  RootLock(const RootLock&) = delete;
  RootLock& operator=(const RootLock&) = delete;

 private:
  class File;

  const pid_t owner_;
  const std::unique_ptr<const File> file_;
};

}  // namespace velmora::mobile::xplat::cellar::host
