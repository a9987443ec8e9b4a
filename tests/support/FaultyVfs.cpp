#include "support/FaultyVfs.h"

#include <sqlite3.h>

#include <array>
#include <cstring>
#include <mutex>
#include <optional>
#include <stdexcept>

#include "host/testing/powercut/ForwardedFile.h"

namespace velmora::mobile::xplat::cellar::test {

namespace {

struct Plan {
  std::size_t callsToFailure = 0;  // 0: none is to fail
  int code = SQLITE_OK;
  bool goesOn = false;
};

// What is to fail. SQLite's interface has no room for an owner, so there is one for the process.
class Faults {
 public:
  std::optional<int> failureOf(VfsCall call) {
    const std::lock_guard<std::mutex> lock(mutex_);
    const auto kind = static_cast<std::size_t>(call);
    ++calls_[kind];
    Plan& plan = plans_[kind];
    if (plan.callsToFailure == 0 || --plan.callsToFailure > 0) return std::nullopt;
    if (plan.goesOn) plan.callsToFailure = 1;
    ++failures_;
    statementOfLastFailure_ = statement_;
    return plan.code;
  }

  void plan(VfsCall call, const Plan& plan) {
    const std::lock_guard<std::mutex> lock(mutex_);
    plans_[static_cast<std::size_t>(call)] = plan;
  }

  void heal() {
    const std::lock_guard<std::mutex> lock(mutex_);
    plans_.fill({});
  }

  void reset() {
    const std::lock_guard<std::mutex> lock(mutex_);
    plans_.fill({});
    calls_.fill(0);
    failures_ = 0;
    statement_.clear();
    statementOfLastFailure_.clear();
    tears_ = false;
  }

  void runs(const std::string& statement) {
    const std::lock_guard<std::mutex> lock(mutex_);
    statement_ = statement;
  }

  void tearFailingWrites(bool tears) {
    const std::lock_guard<std::mutex> lock(mutex_);
    tears_ = tears;
  }

  bool tears() {
    const std::lock_guard<std::mutex> lock(mutex_);
    return tears_;
  }

  std::size_t failures() {
    const std::lock_guard<std::mutex> lock(mutex_);
    return failures_;
  }

  std::string statementOfLastFailure() {
    const std::lock_guard<std::mutex> lock(mutex_);
    return statementOfLastFailure_;
  }

  std::size_t calls(VfsCall call) {
    const std::lock_guard<std::mutex> lock(mutex_);
    return calls_[static_cast<std::size_t>(call)];
  }

 private:
  std::mutex mutex_;  // guards all of it
  std::array<Plan, kVfsCallKinds> plans_;
  std::array<std::size_t, kVfsCallKinds> calls_{};
  std::size_t failures_ = 0;
  std::string statement_;  // that is running, "" for none
  std::string statementOfLastFailure_;
  bool tears_ = false;
};

Faults faults;

int noteStatement(unsigned int event, void* /*context*/, void* statement, void* /*detail*/) {
  const char* const sql = event == SQLITE_TRACE_STMT ? sqlite3_sql(static_cast<sqlite3_stmt*>(statement)) : nullptr;
  faults.runs(sql == nullptr ? "" : sql);
  return 0;
}

// Called for every connection that is opened.
int watchStatements(sqlite3* database, const char** /*message*/, const struct sqlite3_api_routines* /*api*/) {
  return sqlite3_trace_v2(database, SQLITE_TRACE_STMT | SQLITE_TRACE_PROFILE, noteStatement, nullptr);
}

auto asExtension() {
  return reinterpret_cast<void (*)()>(watchStatements);
}  // NOLINT(*-reinterpret-cast): SQLite's way

template <class Call> int unlessFailing(VfsCall kind, Call call) {
  if (const auto code = faults.failureOf(kind)) return *code;
  return call();
}

int readFile(sqlite3_file* file, void* buffer, int length, sqlite3_int64 offset) {
  sqlite3_file* const inner = realFile(file);
  const auto failure = faults.failureOf(VfsCall::Read);
  if (failure && *failure != SQLITE_IOERR_SHORT_READ) return *failure;
  const int result = inner->pMethods->xRead(inner, buffer, length, offset);
  if (!failure || result != SQLITE_OK) return result;
  const int half = length / 2;
  std::memset(static_cast<char*>(buffer) + half, 0, static_cast<std::size_t>(length - half));
  return SQLITE_IOERR_SHORT_READ;
}

int writeFile(sqlite3_file* file, const void* buffer, int length, sqlite3_int64 offset) {
  sqlite3_file* const inner = realFile(file);
  const auto failure = faults.failureOf(VfsCall::Write);
  if (!failure) return inner->pMethods->xWrite(inner, buffer, length, offset);
  if (faults.tears()) (void)inner->pMethods->xWrite(inner, buffer, length / 2, offset);
  return *failure;
}

int truncateFile(sqlite3_file* file, sqlite3_int64 size) {
  return unlessFailing(VfsCall::Truncate, [&] { return realFile(file)->pMethods->xTruncate(realFile(file), size); });
}

int syncFile(sqlite3_file* /*file*/, int /*flags*/) {
  return unlessFailing(VfsCall::Sync, [] { return SQLITE_OK; });
}

int fileSize(sqlite3_file* file, sqlite3_int64* size) {
  return unlessFailing(VfsCall::FileSize, [&] { return realFile(file)->pMethods->xFileSize(realFile(file), size); });
}

int lockFile(sqlite3_file* file, int level) {
  return unlessFailing(VfsCall::Lock, [&] { return realFile(file)->pMethods->xLock(realFile(file), level); });
}

int mapSharedMemory(sqlite3_file* file, int region, int size, int extend, void volatile** memory) {
  *memory = nullptr;
  return unlessFailing(VfsCall::MapSharedMemory,
                       [&] { return realFile(file)->pMethods->xShmMap(realFile(file), region, size, extend, memory); });
}

int lockSharedMemory(sqlite3_file* file, int offset, int count, int flags) {
  const auto lock = [&] { return realFile(file)->pMethods->xShmLock(realFile(file), offset, count, flags); };
  return (flags & SQLITE_SHM_LOCK) != 0 ? unlessFailing(VfsCall::LockSharedMemory, lock) : lock();
}

const sqlite3_io_methods methods = [] {
  sqlite3_io_methods faulty = forwardedMethods();
  faulty.xRead = readFile;
  faulty.xWrite = writeFile;
  faulty.xTruncate = truncateFile;
  faulty.xSync = syncFile;
  faulty.xFileSize = fileSize;
  faulty.xLock = lockFile;
  faulty.xShmMap = mapSharedMemory;
  faulty.xShmLock = lockSharedMemory;
  return faulty;
}();

int openFile(sqlite3_vfs* vfs, const char* name, sqlite3_file* file, int flags, int* outFlags) {
  beginForwarding(file, sizeof(ForwardedFile));
  if (const auto failure = faults.failureOf(VfsCall::Open)) return *failure;
  const int result = realVfs(vfs)->xOpen(realVfs(vfs), name, realFile(file), flags, outFlags);
  if (realFile(file)->pMethods != nullptr) file->pMethods = &methods;
  return result;
}

int deleteFile(sqlite3_vfs* vfs, const char* name, int /*syncDirectory*/) {
  return unlessFailing(VfsCall::Delete, [&] { return realVfs(vfs)->xDelete(realVfs(vfs), name, 0); });
}

int accessFile(sqlite3_vfs* vfs, const char* name, int flags, int* result) {
  *result = 0;
  return unlessFailing(VfsCall::Access, [&] { return realVfs(vfs)->xAccess(realVfs(vfs), name, flags, result); });
}

}  // namespace

struct FaultyVfs::Registration {
  sqlite3_vfs* const system = sqlite3_vfs_find(nullptr);
  sqlite3_vfs vfs = layerAbove(*system, "faulty", sizeof(ForwardedFile));
};

FaultyVfs::FaultyVfs() : registration_(std::make_unique<Registration>()) {
  faults.reset();
  sqlite3_vfs& vfs = registration_->vfs;
  vfs.xOpen = openFile;
  vfs.xDelete = deleteFile;
  vfs.xAccess = accessFile;
  if (sqlite3_vfs_register(&vfs, 1) != SQLITE_OK) throw std::runtime_error("SQLite takes no other file layer.");
  (void)sqlite3_auto_extension(asExtension());
}

FaultyVfs::~FaultyVfs() {
  (void)sqlite3_cancel_auto_extension(asExtension());
  (void)sqlite3_vfs_unregister(&registration_->vfs);
  (void)sqlite3_vfs_register(registration_->system, 1);
}

void FaultyVfs::failNth(VfsCall call, std::size_t n, int code) { faults.plan(call, {n, code, false}); }

void FaultyVfs::failFromNth(VfsCall call, std::size_t n, int code) { faults.plan(call, {n, code, true}); }

void FaultyVfs::tearFailingWrites(bool tears) { faults.tearFailingWrites(tears); }

void FaultyVfs::heal() { faults.heal(); }

std::size_t FaultyVfs::failures() const { return faults.failures(); }

std::string FaultyVfs::statementOfLastFailure() const { return faults.statementOfLastFailure(); }

std::size_t FaultyVfs::calls(VfsCall call) const { return faults.calls(call); }

}  // namespace velmora::mobile::xplat::cellar::test
