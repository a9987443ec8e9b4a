#pragma once

#include <cstddef>
#include <functional>
#include <string>
#include <vector>

#include "Export.h"

namespace velmora::mobile::xplat::cellar {

// The library's only door to the file system, over POSIX. A host or a test may substitute a subclass: operations that
// are composed of others reach them through the virtual interface. Holds no state; any thread may call it, and keeping
// two operations on one path apart is the callers' business.
//
// Every failure is a `FileUtilsIoException` whose description ends in the system's error text and whose code is
// `errno`. Paths are used as given: "/" is the only separator, and nothing is normalised.
class CELLAR_EXPORT FileUtils {
 public:
  enum class Type : int { File = 0, SymLink = 1, Directory = 2 };

  // One entry of a directory.
  struct CELLAR_EXPORT Info {
    Info(const std::string& path, long long size, Type type);

    std::string path;  // the listed directory and the entry's name, combined
    long long size;    // bytes of a regular file; 0 for links and directories
    Type type;
  };

  // A file system's size and what an unprivileged process may still use of it, in bytes.
  struct CELLAR_EXPORT DiskSpace {
    DiskSpace(long long total, long long available);

    long long total;
    long long available;
  };

  virtual ~FileUtils();

  // `a` and `b` with one "/" between them, unless `a` is empty or ends in one. A leading "/" of `b` stays.
  virtual std::string combinePath(const std::string& a, const std::string& b);

  // The last component, trailing slashes skipped: "b" for "/a/b//". A path without a "/" before it comes back whole.
  virtual std::string basename(const std::string& path);

  // What comes before the last component's slash: "/a" for "/a/b". Empty for "/a", "a" and "".
  virtual std::string parentPath(const std::string& path);

  // The bytes of a regular file. Throws for everything else (a directory, a fifo, a device) and waits for nobody.
  virtual std::vector<unsigned char> readFile(const std::string& path);

  // Creates or replaces the file. Neither atomic nor synced: a crash or a full disk midway leaves a part of it. Throws
  // for a fifo, whether somebody reads from it or not.
  virtual void writeFile(const std::string& path, const std::vector<unsigned char>& data);

  // Removes a file, a link (never its target) or an empty directory. Throws when there is none.
  virtual void deleteFile(const std::string& path);

  // Removes a directory and all it holds, depth first. Links are removed as links, one given as the path itself too. A
  // failure stops the walk where it happens: what is deleted by then stays deleted.
  virtual void recursiverDirectoryDelete(const std::string& path);

  // Moves within one file system, replacing a file at `to`.
  virtual void rename(const std::string& from, const std::string& to);

  // Creates a directory (mode 0775 less the umask), and its missing parents when `recursive`. An empty path, and a
  // directory that is there already, are not errors; something else at the path is, with code 0.
  virtual void createDirectory(const std::string& path, bool recursive);

  virtual void createSymLink(const std::string& linkPath, const std::string& targetPath);

  // Whether the path, links followed, leads to a directory. Never throws.
  virtual bool isDirectory(const std::string& path);

  // Whether the path, links followed, leads to anything: a dangling link does not. Never throws.
  virtual bool pathExists(const std::string& path);

  // The figures of the file system that holds the path.
  virtual DiskSpace getDiskSpace(const std::string& path);

  // The bare names of the sub-directories, in the file system's order. Links to directories are none.
  virtual std::vector<std::string> listDirectories(const std::string& path);

  // Files, links and directories, in the file system's order. Sockets, devices and the like are left out, and so is a
  // file that vanishes while it is being listed.
  virtual std::vector<Info> listDirectory(const std::string& path);

  // Whether the path itself, slashes at its end aside, is a link, dangling or not. Never throws.
  virtual bool isSymLink(const std::string& path);

  // The full paths of what `listDirectory` leaves out: fifos, sockets, devices, and entries whose type the file system
  // does not tell. None for what is not a directory, a link among them, and for one that cannot be read.
  virtual std::vector<std::string> listOtherEntries(const std::string& path);

  // Creates a file that is not there yet: code `EEXIST` if something is, a dangling link too. When it fails in the
  // middle, what was written is removed again as far as possible.
  virtual void createFile(const std::string& path, const std::vector<unsigned char>& data);

  // The bytes of a regular file, piece by piece. Otherwise as `readFile`.
  virtual void readPieces(const std::string& path,
                          const std::function<void(const unsigned char* bytes, std::size_t count)>& consume);

  // Waits until what a file contains, or the names in a directory, are on the medium and outlive a power cut.
  virtual void sync(const std::string& path);

  // The bare names of the regular files in a directory, in the file system's order.
  virtual std::vector<std::string> listFiles(const std::string& path);

  // Has the system begin what `sync` of a file waits for, where it can: several files are synced in less time then.
  virtual void beginSync(const std::string& path) noexcept;
};

}  // namespace velmora::mobile::xplat::cellar
