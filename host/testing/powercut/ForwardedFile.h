#pragma once

#include <sqlite3.h>

#include <cstddef>

namespace velmora::mobile::xplat::cellar::test {

// The head of what SQLite knows as a file of a layer above its own; the real one's lies behind the layer's in the same
// block.
struct ForwardedFile {
  sqlite3_file base;
  sqlite3_file* real;
};

sqlite3_file* realFile(sqlite3_file* file);
sqlite3_vfs* realVfs(sqlite3_vfs* vfs);

// Where a file of the layer begins that has not been opened: there is nothing to close yet. `size` is that of the
// layer's own.
void beginForwarding(sqlite3_file* file, std::size_t size);

// Every operation goes to the real file. The second version: without memory-mapped reading, which would go past a
// layer.
sqlite3_io_methods forwardedMethods();

// A layer above `system`, for files of `size` more bytes. What is not replaced in it goes to the real one's functions.
sqlite3_vfs layerAbove(sqlite3_vfs& system, const char* name, std::size_t size);

}  // namespace velmora::mobile::xplat::cellar::test
