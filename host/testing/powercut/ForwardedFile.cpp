#include "host/testing/powercut/ForwardedFile.h"

#include <algorithm>

namespace velmora::mobile::xplat::cellar::test {

namespace {

ForwardedFile& forwarded(sqlite3_file* file) {
  return *reinterpret_cast<ForwardedFile*>(file);  // NOLINT(*-reinterpret-cast): SQLite's way to derive
}

int closeFile(sqlite3_file* file) {
  sqlite3_file* const real = realFile(file);
  return real->pMethods == nullptr ? SQLITE_OK : real->pMethods->xClose(real);
}

int readFile(sqlite3_file* file, void* buffer, int length, sqlite3_int64 offset) {
  return realFile(file)->pMethods->xRead(realFile(file), buffer, length, offset);
}

int writeFile(sqlite3_file* file, const void* buffer, int length, sqlite3_int64 offset) {
  return realFile(file)->pMethods->xWrite(realFile(file), buffer, length, offset);
}

int truncateFile(sqlite3_file* file, sqlite3_int64 size) {
  return realFile(file)->pMethods->xTruncate(realFile(file), size);
}

int syncFile(sqlite3_file* file, int flags) { return realFile(file)->pMethods->xSync(realFile(file), flags); }

int fileSize(sqlite3_file* file, sqlite3_int64* size) {
  return realFile(file)->pMethods->xFileSize(realFile(file), size);
}

int lockFile(sqlite3_file* file, int level) { return realFile(file)->pMethods->xLock(realFile(file), level); }

int unlockFile(sqlite3_file* file, int level) { return realFile(file)->pMethods->xUnlock(realFile(file), level); }

int checkReservedLock(sqlite3_file* file, int* result) {
  return realFile(file)->pMethods->xCheckReservedLock(realFile(file), result);
}

int fileControl(sqlite3_file* file, int operation, void* argument) {
  return realFile(file)->pMethods->xFileControl(realFile(file), operation, argument);
}

int sectorSize(sqlite3_file* file) { return realFile(file)->pMethods->xSectorSize(realFile(file)); }

int deviceCharacteristics(sqlite3_file* file) {
  return realFile(file)->pMethods->xDeviceCharacteristics(realFile(file));
}

int mapSharedMemory(sqlite3_file* file, int region, int size, int extend, void volatile** memory) {
  return realFile(file)->pMethods->xShmMap(realFile(file), region, size, extend, memory);
}

int lockSharedMemory(sqlite3_file* file, int offset, int count, int flags) {
  return realFile(file)->pMethods->xShmLock(realFile(file), offset, count, flags);
}

void sharedMemoryBarrier(sqlite3_file* file) { realFile(file)->pMethods->xShmBarrier(realFile(file)); }

int unmapSharedMemory(sqlite3_file* file, int alsoDelete) {
  return realFile(file)->pMethods->xShmUnmap(realFile(file), alsoDelete);
}

int accessFile(sqlite3_vfs* vfs, const char* name, int flags, int* result) {
  return realVfs(vfs)->xAccess(realVfs(vfs), name, flags, result);
}

int fullPathname(sqlite3_vfs* vfs, const char* name, int size, char* out) {
  return realVfs(vfs)->xFullPathname(realVfs(vfs), name, size, out);
}

}  // namespace

sqlite3_file* realFile(sqlite3_file* file) { return forwarded(file).real; }

sqlite3_vfs* realVfs(sqlite3_vfs* vfs) { return static_cast<sqlite3_vfs*>(vfs->pAppData); }

void beginForwarding(sqlite3_file* file, std::size_t size) {
  ForwardedFile& own = forwarded(file);
  own.base.pMethods = nullptr;
  // NOLINTNEXTLINE(*-reinterpret-cast): SQLite made room for both
  own.real = reinterpret_cast<sqlite3_file*>(reinterpret_cast<char*>(file) + size);
  own.real->pMethods = nullptr;
}

sqlite3_io_methods forwardedMethods() {
  return {2,
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
}

sqlite3_vfs layerAbove(sqlite3_vfs& system, const char* name, std::size_t size) {
  sqlite3_vfs vfs = system;
  vfs.iVersion = std::min(vfs.iVersion, 2);
  vfs.szOsFile += static_cast<int>(size);
  vfs.zName = name;
  vfs.pNext = nullptr;
  vfs.pAppData = &system;
  vfs.xAccess = accessFile;
  vfs.xFullPathname = fullPathname;
  return vfs;
}

}  // namespace velmora::mobile::xplat::cellar::test
