#pragma once

#include <cstddef>
#include <memory>
#include <string>

namespace velmora::mobile::xplat::cellar::test {

// What SQLite asks of the system.
enum class VfsCall {
  Open,
  Read,
  Write,
  Truncate,
  Sync,
  FileSize,
  Lock,
  Delete,
  Access,
  MapSharedMemory,
  LockSharedMemory,
};
constexpr std::size_t kVfsCallKinds = 11;

// While it lives, SQLite does all its file access in this process through it: the real one, with chosen calls failing.
// Connections that were opened meanwhile must be closed before it goes. One at a time. Thread-safe, though which
// statement met a failure is only known where one thread alone uses SQLite.
//
// Syncing waits for no disk: no test outlives a power cut. A failing call has done nothing, with two exceptions: a read
// that fails with SQLITE_IOERR_SHORT_READ has read the first half and filled up with zeros, as SQLite demands, and a
// write may be told to be torn.
class FaultyVfs {
 public:
  FaultyVfs();
  FaultyVfs(const FaultyVfs&) = delete;
  FaultyVfs& operator=(const FaultyVfs&) = delete;
  ~FaultyVfs();

  // The n-th call of that kind from now fails with an SQLite result code; 1 is the next. Unlocking never fails.
  void failNth(VfsCall call, std::size_t n, int code);

  // That call and all of its kind after it.
  void failFromNth(VfsCall call, std::size_t n, int code);

  // From now on a write that is made to fail leaves its first half behind.
  void tearFailingWrites(bool tears);

  // From here on nothing fails.
  void heal();

  // How many calls have been made to fail so far.
  std::size_t failures() const;

  // The statement that was running when the latest of them failed; "" between statements, as in opening and closing.
  std::string statementOfLastFailure() const;

  // How many calls of a kind there were, failed ones included.
  std::size_t calls(VfsCall call) const;

 private:
  struct Registration;
  const std::unique_ptr<Registration> registration_;
};

}  // namespace velmora::mobile::xplat::cellar::test
