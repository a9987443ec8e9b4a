#include "host/testing/powercut/RecordingVfs.h"

#include <sqlite3.h>

#include <algorithm>
#include <exception>
#include <mutex>
#include <new>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

namespace velmora::mobile::xplat::cellar::test {

namespace {

// What is known of an open file beside the real one. Without a record it lies outside all trees.
struct Opened {
  std::shared_ptr<SharedDiskRecord> record;
  NodePtr node;
  std::string path;
  bool syncsDirectory = false;  // with the first sync
  bool hasSharedMemory = false;
};

// What SQLite knows as the file; the real one's lies behind it in the same block.
struct File {
  sqlite3_file base;
  sqlite3_file* real;
  Opened* opened;
};

Opened& opened(sqlite3_file* file) {
  return *reinterpret_cast<File*>(file)->opened;  // NOLINT(*-reinterpret-cast): SQLite's way to derive
}

sqlite3_file* real(sqlite3_file* file) {
  return reinterpret_cast<File*>(file)->real;  // NOLINT(*-reinterpret-cast): SQLite's way to derive
}

sqlite3_vfs* real(sqlite3_vfs* vfs) { return static_cast<sqlite3_vfs*>(vfs->pAppData); }

// SQLite's C functions between the caller and this do not pass an exception on.
template <class Call> int guarded(int codeOfFailure, const Call& call) noexcept {
  try {
    return call();
  } catch (const std::bad_alloc&) {
    return SQLITE_NOMEM;
  } catch (const std::exception&) {
    return codeOfFailure;
  }
}

// Runs a real operation, and records it if it succeeds and the file lies in a tree.
template <class Operation, class Record> int recorded(const std::shared_ptr<SharedDiskRecord>& record,
                                                      int codeOfFailure, const Operation& operation,
                                                      const Record& note) noexcept {
  if (!record) return operation();
  return guarded(codeOfFailure, [&] {
    int result = SQLITE_OK;
    record->perform([&](DiskRecord& disk) {
      result = operation();
      if (result == SQLITE_OK) note(disk);
    });
    return result;
  });
}

int closeFile(sqlite3_file* file) {
  const std::unique_ptr<Opened> last(&opened(file));
  sqlite3_file* const inner = real(file);
  return inner->pMethods == nullptr ? SQLITE_OK : inner->pMethods->xClose(inner);
}

int readFile(sqlite3_file* file, void* buffer, int length, sqlite3_int64 offset) {
  return real(file)->pMethods->xRead(real(file), buffer, length, offset);
}

int writeFile(sqlite3_file* file, const void* buffer, int length, sqlite3_int64 offset) {
  const auto write = [&] { return real(file)->pMethods->xWrite(real(file), buffer, length, offset); };
  const auto note = [&](DiskRecord& /*disk*/) {
    const auto* const bytes = static_cast<const unsigned char*>(buffer);
    opened(file).node->content.write(static_cast<std::size_t>(offset), {bytes, bytes + length});
  };
  return recorded(opened(file).record, SQLITE_IOERR_WRITE, write, note);
}

int truncateFile(sqlite3_file* file, sqlite3_int64 size) {
  const auto truncate = [&] { return real(file)->pMethods->xTruncate(real(file), size); };
  const auto note = [&](DiskRecord& /*disk*/) { opened(file).node->content.truncate(static_cast<std::size_t>(size)); };
  return recorded(opened(file).record, SQLITE_IOERR_TRUNCATE, truncate, note);
}

// The first sync of a journal or a log that may have been created syncs its directory, as the system's layer does. That
// of a database alone does not make its name durable.
int syncFile(sqlite3_file* file, int /*flags*/) {
  const auto note = [&](DiskRecord& disk) {
    opened(file).node->content.sync();
    if (std::exchange(opened(file).syncsDirectory, false)) disk.syncedParentOf(opened(file).path);
  };
  return recorded(
      opened(file).record, SQLITE_IOERR_FSYNC, [] { return SQLITE_OK; }, note);
}

int fileSize(sqlite3_file* file, sqlite3_int64* size) { return real(file)->pMethods->xFileSize(real(file), size); }

int lockFile(sqlite3_file* file, int level) { return real(file)->pMethods->xLock(real(file), level); }

int unlockFile(sqlite3_file* file, int level) { return real(file)->pMethods->xUnlock(real(file), level); }

int checkReservedLock(sqlite3_file* file, int* result) {
  return real(file)->pMethods->xCheckReservedLock(real(file), result);
}

int fileControl(sqlite3_file* file, int operation, void* argument) {
  return real(file)->pMethods->xFileControl(real(file), operation, argument);
}

int sectorSize(sqlite3_file* file) { return real(file)->pMethods->xSectorSize(real(file)); }

// A medium that promises no more than to leave alone what is beside a write.
int deviceCharacteristics(sqlite3_file* file) {
  return real(file)->pMethods->xDeviceCharacteristics(real(file)) & SQLITE_IOCAP_POWERSAFE_OVERWRITE;
}

int mapSharedMemory(sqlite3_file* file, int region, int size, int extend, void volatile** memory) {
  *memory = nullptr;
  if (opened(file).record && !std::exchange(opened(file).hasSharedMemory, true)) {
    const int result = guarded(SQLITE_IOERR_SHMOPEN, [&] {
      opened(file).record->perform([&](DiskRecord& disk) { disk.disregard(opened(file).path + "-shm"); });
      return SQLITE_OK;
    });
    if (result != SQLITE_OK) return result;
  }
  return real(file)->pMethods->xShmMap(real(file), region, size, extend, memory);
}

int lockSharedMemory(sqlite3_file* file, int offset, int count, int flags) {
  return real(file)->pMethods->xShmLock(real(file), offset, count, flags);
}

void sharedMemoryBarrier(sqlite3_file* file) { real(file)->pMethods->xShmBarrier(real(file)); }

int unmapSharedMemory(sqlite3_file* file, int alsoDelete) {
  return real(file)->pMethods->xShmUnmap(real(file), alsoDelete);
}

// The second version: without memory-mapped reading, which would go past this layer.
const sqlite3_io_methods methods = {2,
                                    closeFile,
                                    readFile,
                                    writeFile,
                                    truncateFile,
                                    syncFile,
                                    fileSize,
                                    lockFile,
                                    unlockFile,
                                    checkReservedLock,
                                    fileControl,
                                    sectorSize,
                                    deviceCharacteristics,
                                    mapSharedMemory,
                                    lockSharedMemory,
                                    sharedMemoryBarrier,
                                    unmapSharedMemory,
                                    nullptr,
                                    nullptr};

// The trees, and the layer that is there as long as there are any.
class Layer {
 public:
  void add(const std::shared_ptr<SharedDiskRecord>& record);
  void remove(const std::shared_ptr<SharedDiskRecord>& record);

  // The tree that a path lies in, null for none.
  std::shared_ptr<SharedDiskRecord> recordOf(const char* path) {
    const std::lock_guard<std::mutex> lock(mutex_);
    const auto found =
        std::find_if(records_.begin(), records_.end(), [&](const auto& record) { return record->contains(path); });
    return found == records_.end() ? nullptr : *found;
  }

 private:
  std::mutex mutex_;  // guards all of it
  std::vector<std::shared_ptr<SharedDiskRecord>> records_;
  sqlite3_vfs vfs_ = {};
};

Layer& layer() {
  static Layer only;
  return only;
}

std::unique_ptr<Opened> stateOf(const char* name, int flags) {
  auto state = std::make_unique<Opened>();
  if (name == nullptr || (flags & SQLITE_OPEN_DELETEONCLOSE) != 0) return state;
  constexpr int journals = SQLITE_OPEN_MAIN_JOURNAL | SQLITE_OPEN_SUPER_JOURNAL | SQLITE_OPEN_WAL;
  state->path = name;
  state->record = layer().recordOf(name);
  state->syncsDirectory = (flags & SQLITE_OPEN_CREATE) != 0 && (flags & journals) != 0;
  return state;
}

int openFile(sqlite3_vfs* vfs, const char* name, sqlite3_file* file, int flags, int* outFlags) {
  File& own = *reinterpret_cast<File*>(file);            // NOLINT(*-reinterpret-cast): SQLite's way to derive
  own.base.pMethods = nullptr;                           // nothing to close yet
  own.real = reinterpret_cast<sqlite3_file*>(&own + 1);  // NOLINT(*-reinterpret-cast): SQLite made room for both
  own.real->pMethods = nullptr;
  return guarded(SQLITE_CANTOPEN, [&] {
    std::unique_ptr<Opened> state = stateOf(name, flags);
    own.opened = state.get();
    const auto open = [&] {
      const int result = real(vfs)->xOpen(real(vfs), name, own.real, flags, outFlags);
      if (own.real->pMethods != nullptr) own.base.pMethods = &methods;
      return result;
    };
    const auto record = state->record;
    const int result = recorded(record, SQLITE_CANTOPEN, open,
                                [&](DiskRecord& disk) { own.opened->node = disk.openedAsDatabase(name); });
    if (!state->node) state->record = nullptr;
    if (own.base.pMethods != nullptr) (void)state.release();  // until it is closed
    return result;
  });
}

int deleteFile(sqlite3_vfs* vfs, const char* name, int syncsDirectory) {
  const auto remove = [&] { return real(vfs)->xDelete(real(vfs), name, 0); };
  return guarded(SQLITE_IOERR_DELETE, [&] {
    const auto note = [&](DiskRecord& disk) {
      (void)disk.observe(name);
      if ((syncsDirectory & 1) != 0) disk.syncedParentOf(name);
    };
    return recorded(layer().recordOf(name), SQLITE_IOERR_DELETE, remove, note);
  });
}

int accessFile(sqlite3_vfs* vfs, const char* name, int flags, int* result) {
  return real(vfs)->xAccess(real(vfs), name, flags, result);
}

int fullPathname(sqlite3_vfs* vfs, const char* name, int size, char* out) {
  return real(vfs)->xFullPathname(real(vfs), name, size, out);
}

void Layer::add(const std::shared_ptr<SharedDiskRecord>& record) {
  const std::lock_guard<std::mutex> lock(mutex_);
  records_.push_back(record);
  if (records_.size() > 1) return;
  sqlite3_vfs* const system = sqlite3_vfs_find(nullptr);
  if (system != nullptr) {
    vfs_ = *system;  // what is not replaced here goes to the real one's functions
    vfs_.iVersion = std::min(vfs_.iVersion, 2);
    vfs_.szOsFile += static_cast<int>(sizeof(File));
    vfs_.zName = "recording";
    vfs_.pNext = nullptr;
    vfs_.pAppData = system;
    vfs_.xOpen = openFile;
    vfs_.xDelete = deleteFile;
    vfs_.xAccess = accessFile;
    vfs_.xFullPathname = fullPathname;
    if (sqlite3_vfs_register(&vfs_, 1) == SQLITE_OK) return;
  }
  records_.clear();
  throw std::runtime_error("SQLite takes no other file layer.");
}

void Layer::remove(const std::shared_ptr<SharedDiskRecord>& record) {
  const std::lock_guard<std::mutex> lock(mutex_);
  records_.erase(std::find(records_.begin(), records_.end(), record));
  if (!records_.empty()) return;
  (void)sqlite3_vfs_unregister(&vfs_);
  (void)sqlite3_vfs_register(real(&vfs_), 1);
}

}  // namespace

RecordedDatabases::RecordedDatabases(std::shared_ptr<SharedDiskRecord> record) : record_(std::move(record)) {
  layer().add(record_);
}

RecordedDatabases::~RecordedDatabases() { layer().remove(record_); }

}  // namespace velmora::mobile::xplat::cellar::test
