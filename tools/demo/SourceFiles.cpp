#include "demo/SourceFiles.h"

#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <system_error>
#include <utility>

#include "AttributeStore.h"
#include "Format.h"
#include "InputError.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

// Files beyond which a directory is not searched any further.
constexpr std::size_t kMostLookedAt = 4 * SourceFiles::kMostFiles;

// All files that there are to choose from.
class Reader {
 public:
  Reader(const fs::path& directory, const fs::path& without) : directory_(directory), without_(without) {}

  SourceFiles read() {
    std::error_code error;
    const std::vector<fs::directory_entry> entries = sortedEntries(directory_, error);
    if (error) throw InputError("cannot read DIRECTORY '" + directory_.string() + "': " + error.message());
    take(entries);
    return std::move(source_);
  }

 private:
  static std::vector<fs::directory_entry> sortedEntries(const fs::path& directory, std::error_code& error) {
    std::vector<fs::directory_entry> entries;
    for (fs::directory_iterator entry(directory, error); !error && entry != fs::directory_iterator();) {
      entries.push_back(*entry);
      entry.increment(error);
    }
    std::sort(entries.begin(), entries.end());
    return entries;
  }

  void take(const std::vector<fs::directory_entry>& entries) {
    for (const fs::directory_entry& entry : entries) {
      if (source_.files.size() == kMostLookedAt) {
        source_.isPart = true;
        return;
      }
      takeEntry(entry);
    }
  }

  void takeEntry(const fs::directory_entry& entry) {
    if (entry.path().filename() == AttributeStore::fileName) return;  // belongs to the library in every store
    std::error_code error;
    const fs::file_status status = entry.symlink_status(error);
    if (fs::is_directory(status)) return takeDirectory(entry.path());
    if (fs::is_regular_file(status)) takeFile(entry.path());
  }

  void takeDirectory(const fs::path& path) {
    std::error_code error;
    if (fs::equivalent(path, without_, error)) return;
    error.clear();
    const std::vector<fs::directory_entry> entries = sortedEntries(path, error);
    if (error) ++source_.unreadable;
    take(entries);
  }

  void takeFile(const fs::path& path) {
    std::error_code error;
    const std::uint64_t size = fs::file_size(path, error);
    if (error || access(path.c_str(), R_OK) != 0) {
      ++source_.unreadable;
    } else {
      source_.files.push_back({path.string(), path.lexically_relative(directory_).string(), size});
    }
  }

  const fs::path directory_;
  const fs::path without_;
  SourceFiles source_;
};

// In their order, none of more than `largest` bytes, as far as number and bytes allow.
SourceFiles take(const SourceFiles& found, std::uint64_t largest) {
  SourceFiles taken;
  taken.unreadable = found.unreadable;
  for (const SourceFiles::File& file : found.files) {
    if (taken.files.size() == SourceFiles::kMostFiles) break;
    if (file.size > largest || taken.bytes + file.size > SourceFiles::kMostBytes) continue;
    taken.bytes += file.size;
    taken.files.push_back(file);
  }
  taken.isPart = found.isPart || taken.files.size() < found.files.size();
  return taken;
}

// Tries smaller and smaller files until there are enough, and settles for the largest ones that give the most.
SourceFiles choose(const SourceFiles& found) {
  const std::size_t enough = std::min(found.files.size(), SourceFiles::kMostFiles);
  SourceFiles best = take(found, SourceFiles::kMostBytes);
  for (std::uint64_t largest = SourceFiles::kMostBytes / 2; largest > 0 && best.files.size() < enough; largest /= 2) {
    SourceFiles next = take(found, largest);
    if (next.files.size() > best.files.size()) best = std::move(next);
  }
  return best;
}

void requireDirectory(const std::string& directory) {
  std::error_code error;
  const fs::file_status status = fs::status(directory, error);
  if (status.type() == fs::file_type::not_found) throw InputError("DIRECTORY '" + directory + "' does not exist");
  if (error) throw InputError("cannot read DIRECTORY '" + directory + "': " + error.message());
  if (!fs::is_directory(status)) throw InputError("DIRECTORY '" + directory + "' is not a directory");
}

Bytes beginningOf(const SourceFiles::File& file, std::uint64_t bytes) {
  Bytes contents(static_cast<std::size_t>(std::min(file.size, bytes)));
  std::ifstream in(file.path, std::ios::binary);
  in.read(reinterpret_cast<char*>(contents.data()), static_cast<std::streamsize>(contents.size()));
  contents.resize(static_cast<std::size_t>(in.gcount()));
  return contents;
}

}  // namespace

SourceFiles readSourceFiles(const std::string& directory, const std::string& without) {
  requireDirectory(directory);
  SourceFiles source = choose(Reader(directory, without).read());
  if (!source.files.empty()) return source;
  if (source.isPart) {
    throw InputError("DIRECTORY '" + directory + "' holds only files of more than " +
                     formatSize(SourceFiles::kMostBytes));
  }
  if (source.unreadable > 0) throw InputError("nothing in DIRECTORY '" + directory + "' can be read");
  throw InputError("DIRECTORY '" + directory + "' holds no files");
}

Bytes contentsOf(const SourceFiles::File& file) { return beginningOf(file, file.size); }

Bytes pictureOf(const SourceFiles::File& file, std::size_t bytes) {
  Bytes picture = beginningOf(file, bytes);
  if (picture.empty()) picture.push_back(' ');
  for (std::size_t size = picture.size(); size < bytes; size = picture.size()) {
    picture.resize(std::min(bytes, 2 * size));
    std::copy_n(picture.begin(), picture.size() - size, picture.begin() + static_cast<std::ptrdiff_t>(size));
  }
  return picture;
}

}  // namespace velmora::mobile::xplat::cellar::tools
