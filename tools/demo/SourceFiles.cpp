#include "demo/SourceFiles.h"

#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <system_error>
#include <utility>

#include "Format.h"
#include "InputError.h"
#include "LarderException.h"
#include "storage/StoreFiles.h"
#include "storage/UntouchedFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

void requireDirectory(const std::string& directory) {
  std::error_code error;
  const fs::directory_iterator entries(directory, error);
  const std::string quoted = "DIRECTORY '" + directory + "'";
  if (error == std::errc::no_such_file_or_directory) throw InputError(quoted + " does not exist");
  if (error == std::errc::not_a_directory) throw InputError(quoted + " is not a directory");
  if (error) throw InputError("cannot read " + quoted + ": " + error.message());
}

// Lists the files of a tree by name, up to the number that may be taken.
class Search {
 public:
  Search(const std::string& directory, const std::string& without) : directory_(directory), without_(without) {}

  // `below` is empty, or ends in a "/".
  void searchDirectory(const std::string& below) {
    std::error_code ignored;
    if (fs::equivalent(directory_ + "/" + below, without_, ignored)) return;
    try {
      for (const Entry& entry : listUntouched(directory_ + "/" + below)) look(below, entry);
    } catch (const FileUtilsIoException&) {
      ++found_.unreadable;
    }
  }

  SourceFiles found() { return std::move(found_); }

 private:
  void look(const std::string& below, const Entry& entry) {
    if (found_.isPart) return;
    if (entry.type == Entry::Type::Directory) searchDirectory(below + entry.name + "/");
    // The library has attributes of its own in every store.
    if (entry.type == Entry::Type::File && !isAttributesFile(entry)) take(below + entry.name, entry.size);
  }

  void take(const std::string& name, std::uint64_t size) {
    const std::string path = directory_ + "/" + name;
    if (found_.files.size() == SourceFiles::kMostFiles) {
      found_.isPart = true;
    } else if (access(path.c_str(), R_OK) != 0) {
      ++found_.unreadable;
    } else {
      found_.files.push_back({path, name, size});
    }
  }

  const std::string directory_;
  const std::string without_;
  SourceFiles found_;
};

void leaveOutLargest(SourceFiles& source) {
  using File = SourceFiles::File;
  std::sort(source.files.begin(), source.files.end(), [](const File& a, const File& b) { return a.size < b.size; });
  const auto isTooMuch = [&](const File& file) {
    if (source.bytes + file.size > SourceFiles::kMostBytes) return true;
    source.bytes += file.size;
    return false;
  };
  const auto firstOut = std::find_if(source.files.begin(), source.files.end(), isTooMuch);
  source.isPart = source.isPart || firstOut != source.files.end();
  source.files.erase(firstOut, source.files.end());
  std::sort(source.files.begin(), source.files.end(), [](const File& a, const File& b) { return a.name < b.name; });
}

}  // namespace

SourceFiles readSourceFiles(const std::string& directory, const std::string& without) {
  requireDirectory(directory);
  Search search(directory, without);
  search.searchDirectory("");
  SourceFiles source = search.found();
  leaveOutLargest(source);
  if (!source.files.empty()) return source;
  if (source.isPart) {
    throw InputError("DIRECTORY '" + directory + "' holds only files of more than " +
                     formatSize(SourceFiles::kMostBytes));
  }
  if (source.unreadable > 0) throw InputError("nothing in DIRECTORY '" + directory + "' can be read");
  throw InputError("DIRECTORY '" + directory + "' holds no files");
}

Bytes contentsOf(const SourceFiles::File& file, std::uint64_t most) {
  Bytes contents(static_cast<std::size_t>(std::min(file.size, most)));
  std::ifstream in(file.path, std::ios::binary);
  in.read(reinterpret_cast<char*>(contents.data()), static_cast<std::streamsize>(contents.size()));
  contents.resize(static_cast<std::size_t>(in.gcount()));
  return contents;
}

Bytes pictureOf(const SourceFiles::File& file, std::size_t bytes) {
  Bytes picture = contentsOf(file, bytes);
  if (picture.empty()) picture.push_back(' ');
  for (std::size_t i = 0; picture.size() < bytes; ++i) picture.push_back(picture[i]);
  return picture;
}

}  // namespace velmora::mobile::xplat::cellar::tools
