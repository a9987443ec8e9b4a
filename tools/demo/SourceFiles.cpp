#include "demo/SourceFiles.h"

#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <system_error>

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

void take(SourceFiles& source, const SourceFiles::File& file) {
  if (source.files.size() == SourceFiles::kMostFiles) {
    source.isPart = true;
  } else if (access(file.path.c_str(), R_OK) != 0) {
    ++source.unreadable;
  } else {
    source.files.push_back(file);
  }
}

// Takes the files of a tree by name, up to the number that may be taken. `below` is empty, or ends in a "/".
void takeTree(SourceFiles& source, const std::string& root, const std::string& below, const std::string& without) {
  const std::string directory = root + "/" + below;
  std::error_code ignored;
  if (source.isPart || fs::equivalent(directory, without, ignored)) return;
  try {
    for (const Entry& entry : listUntouched(directory)) {
      if (isAttributesFile(entry)) continue;  // the library has one of its own in every store
      const std::string name = below + entry.name;
      if (entry.type == Entry::Type::Directory) takeTree(source, root, name + "/", without);
      if (entry.type == Entry::Type::File) take(source, {directory + entry.name, name, entry.size});
    }
  } catch (const FileUtilsIoException&) {
    ++source.unreadable;
  }
}

void leaveOutLargest(SourceFiles& source) {
  std::vector<SourceFiles::File>& files = source.files;
  const auto sortBy = [&](auto member) {
    std::sort(files.begin(), files.end(), [&](const auto& a, const auto& b) { return a.*member < b.*member; });
  };
  sortBy(&SourceFiles::File::size);
  for (const SourceFiles::File& file : files) source.bytes += file.size;
  for (; source.bytes > SourceFiles::kMostBytes; files.pop_back()) {
    source.bytes -= files.back().size;
    source.isPart = true;
  }
  sortBy(&SourceFiles::File::name);
}

}  // namespace

SourceFiles readSourceFiles(const std::string& directory, const std::string& without) {
  requireDirectory(directory);
  SourceFiles source;
  takeTree(source, directory, "", without);
  leaveOutLargest(source);
  if (!source.files.empty()) return source;
  const std::string quoted = "DIRECTORY '" + directory + "'";
  if (source.isPart) throw InputError(quoted + " holds only files of more than " + formatSize(SourceFiles::kMostBytes));
  if (source.unreadable > 0) throw InputError("nothing in " + quoted + " can be read");
  throw InputError(quoted + " holds no files");
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
