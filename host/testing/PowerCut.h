#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <string>

#include <cellar/Export.h>

namespace velmora::mobile::xplat::cellar {
class FileUtils;
}

namespace velmora::mobile::xplat::cellar::test {

class RecordedDatabases;
class SharedDiskRecord;

// Simulated power cuts. Records what is done in a directory, which is used as ever meanwhile, and what of it has been
// synced. At any moment, and as often as wanted, it writes into another directory what a disk might contain if the
// power had failed now; what was running goes on undisturbed. A test then opens a fresh store on that and looks.
//
// Recorded is what goes through `files` and, while the object lives, what SQLite does through its default file layer.
// What is done by other means, such as by a `Writer`, is found by looking, with the next operation on the same path, a
// sync of it, or a power cut. It counts as not synced until `files` syncs it, even if whoever wrote it has synced it. A
// file that has only become longer has been added to; one that has changed otherwise has been emptied and written.
//
// What outlives a power cut:
// - All that is in the directory at the beginning.
// - The content that a file has when it is synced. Of each later write, independently of the others: all, a beginning,
//   some of its sectors of 512 bytes, its effect on the size alone (with zeros for what was written), or nothing. The
//   later ones of two writes may be there without the earlier one, unless both concern the same sector. Of each later
//   truncation: all or nothing. A write damages nothing outside its own bytes.
// - The entries that a directory has when it is synced; syncing a file does not sync the directory that has it, and
//   syncing a directory does not sync the one above. Of each later creation, rename and deletion, independently of the
//   others: all or nothing. So a deleted file may be back, and a file or a directory may have vanished with all that
//   was synced in it. A rename leaves the old name or the new one; between two directories it is durable with a sync of
//   either.
// - Not the shared memory beside a database (its -shm file), which SQLite makes anew.
//
// SQLite syncs the directory itself where the system's layer does: with the first sync of a journal or a log that it
// may have created, and with a deletion that asks for it (synchronous=EXTRA). Fifos, sockets and devices, hard links,
// modes and dates are not simulated.
//
// While one of these objects lives, no sync waits for the disk: neither `files`, in the directory or outside, nor
// SQLite. Whatever sync there is, it succeeds.
//
// Thread-safe. Several may live at once, for directories that are not inside one another; SQLite's default file layer
// must not be replaced by others meanwhile. SQLite's connections that were opened while one lived must be closed before
// the last one goes. All content is kept in memory: the durable, the present, and each write since the last sync.
class CELLAR_EXPORT PowerCut {
 public:
  // The directory must exist. Throws FileUtilsIoException if it cannot be read, std::runtime_error if SQLite does not
  // take the file layer.
  explicit PowerCut(const std::string& directory);
  PowerCut(const PowerCut&) = delete;
  PowerCut& operator=(const PowerCut&) = delete;
  ~PowerCut();

  // The real file system, recorded where it concerns the directory. The same object each time, which may be used
  // longer than this one lives; it then records no databases.
  std::shared_ptr<FileUtils> files() const;

  // Writes what may be left if the power fails now. The other directory is created, with those above it, unless it is
  // there; it must be empty and outside the recorded one, or this throws std::invalid_argument. The same seed at the
  // same point of the same sequence of operations gives the same remains. A link to an absolute path inside the
  // directory leads to the same place inside the other one. Throws FileUtilsIoException if either cannot be read or
  // written.
  void cutInto(const std::string& otherDirectory, std::uint32_t seed) const;

  // From now on `callback` is called after each recorded operation (all that may change something, and each sync), in
  // its thread and without a lock: it may call `cutInto`, so that the power fails in the middle of an operation of a
  // store. It must not throw, and not use the database or the store that is at work. Empty: none.
  void onOperation(std::function<void()> callback);

 private:
  const std::shared_ptr<SharedDiskRecord> record_;
  const std::shared_ptr<FileUtils> files_;
  const std::unique_ptr<RecordedDatabases> databases_;
};

}  // namespace velmora::mobile::xplat::cellar::test
