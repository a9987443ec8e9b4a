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

#include "host/testing/powercut/ForwardedFile.h"

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

struct File {
  ForwardedFile forwarded;
  Opened* opened;
};

Opened& opened(sqlite3_file* file) {
  return *reinterpret_cast<File*>(file)->opened;  // NOLINT(*-reinterpret-cast): SQLite's way to derive
}

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
  return forwardedMethods().xClose(file);
}

int writeFile(sqlite3_file* file, const void* buffer, int length, sqlite3_int64 offset) {
  const auto write = [&] { return realFile(file)->pMethods->xWrite(realFile(file), buffer, length, offset); };
  const auto note = [&](DiskRecord& /*disk*/) {
    const auto* const bytes = static_cast<const unsigned char*>(buffer);
    opened(file).node->content.write(static_cast<std::size_t>(offset), {bytes, bytes + length});
  };
  return recorded(opened(file).record, SQLITE_IOERR_WRITE, write, note);
}

int truncateFile(sqlite3_file* file, sqlite3_int64 size) {
  const auto truncate = [&] { return realFile(file)->pMethods->xTruncate(realFile(file), size); };
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

// A medium that promises no more than to leave alone what is beside a write.
int deviceCharacteristics(sqlite3_file* file) {
  return realFile(file)->pMethods->xDeviceCharacteristics(realFile(file)) & SQLITE_IOCAP_POWERSAFE_OVERWRITE;
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
  return realFile(file)->pMethods->xShmMap(realFile(file), region, size, extend, memory);
}

const sqlite3_io_methods methods = [] {
  sqlite3_io_methods recording = forwardedMethods();
  recording.xClose = closeFile;
  recording.xWrite = writeFile;
  recording.xTruncate = truncateFile;
  recording.xSync = syncFile;
  recording.xDeviceCharacteristics = deviceCharacteristics;
  recording.xShmMap = mapSharedMemory;
  return recording;
}();

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
  File& own = *reinterpret_cast<File*>(file);  // NOLINT(*-reinterpret-cast): SQLite's way to derive
  beginForwarding(file, sizeof(File));
  return guarded(SQLITE_CANTOPEN, [&] {
    std::unique_ptr<Opened> state = stateOf(name, flags);
    own.opened = state.get();
    const auto open = [&] {
      const int result = realVfs(vfs)->xOpen(realVfs(vfs), name, realFile(file), flags, outFlags);
      if (realFile(file)->pMethods != nullptr) file->pMethods = &methods;
      return result;
    };
    const auto record = state->record;
    const int result = recorded(record, SQLITE_CANTOPEN, open,
                                [&](DiskRecord& disk) { own.opened->node = disk.openedAsDatabase(name); });
    if (!state->node) state->record = nullptr;
    if (file->pMethods != nullptr) (void)state.release();  // until it is closed
    return result;
  });
}

int deleteFile(sqlite3_vfs* vfs, const char* name, int syncsDirectory) {
  const auto remove = [&] { return realVfs(vfs)->xDelete(realVfs(vfs), name, 0); };
  return guarded(SQLITE_IOERR_DELETE, [&] {
    const auto note = [&](DiskRecord& disk) {
      (void)disk.observe(name);
      if ((syncsDirectory & 1) != 0) disk.syncedParentOf(name);
    };
    return recorded(layer().recordOf(name), SQLITE_IOERR_DELETE, remove, note);
  });
}

void Layer::add(const std::shared_ptr<SharedDiskRecord>& record) {
  const std::lock_guard<std::mutex> lock(mutex_);
  records_.push_back(record);
  if (records_.size() > 1) return;
  sqlite3_vfs* const system = sqlite3_vfs_find(nullptr);
  if (system != nullptr) {
    vfs_ = layerAbove(*system, "recording", sizeof(File));
    vfs_.xOpen = openFile;
    vfs_.xDelete = deleteFile;
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
  (void)sqlite3_vfs_register(realVfs(&vfs_), 1);
}

}  // namespace

RecordedDatabases::RecordedDatabases(std::shared_ptr<SharedDiskRecord> record) : record_(std::move(record)) {
  layer().add(record_);
}

RecordedDatabases::~RecordedDatabases() { layer().remove(record_); }

}  // namespace velmora::mobile::xplat::cellar::test
