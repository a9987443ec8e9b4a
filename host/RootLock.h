#pragma once

#include <sys/types.h>

#include <memory>
#include <string>

#include <cellar/Export.h>

namespace velmora::mobile::xplat::cellar::host {

// Lets one host at a time use a directory of storage: two hosts in one root would lose each other's values. It is an
// advisory lock (`flock`) on the file "_cellar_lock" in the directory. The file contains the process id of the owner
// (unless it has another name, too: then it is not written) and remains when the lock is released. For applications
// that build their own host; `Host` has such a lock.
//
// The lock belongs to this object, not to the process: a second one is refused in the same process, too. The system
// releases it when the process ends, for whatever reason. A child process inherits it by fork, not by exec: if the
// owner is killed, such a child keeps the directory locked until it ends.
class CELLAR_EXPORT RootLock {
 public:
  static const std::string fileName;  // "_cellar_lock"

  // Acquires the lock, or fails at once. Throws `FileUtilsIoException`: code `EWOULDBLOCK` if the directory is locked
  // already, with the directory and the owner's process id in the text; else the code of the failed operation (for
  // example on a file system without locks), or 0 if the lock file is not a regular file. Links are not followed. The
  // directory must exist.
  //
  // An owner in this process that has announced its end is waited for, but not on threads of the host kit's queues: it
  // may need them.
  explicit RootLock(const std::string& root);

  // Announces that the lock will be released soon, so that it is waited for. Thread-safe.
  void announceEnd() const;

  // Releases the lock in the process that acquired it; in a forked child it does nothing, and the parent keeps the
  // lock.
  ~RootLock();

  RootLock(const RootLock&) = delete;
  RootLock& operator=(const RootLock&) = delete;

 private:
  class File;

  const pid_t owner_;
  const std::unique_ptr<const File> file_;
};

}  // namespace velmora::mobile::xplat::cellar::host
