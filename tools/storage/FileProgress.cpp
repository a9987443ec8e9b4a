#include "storage/FileProgress.h"

#include "Console.h"
#include "Progress.h"
#include "storage/UntouchedFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

std::uint64_t countFiles(const std::string& directory) {
  std::uint64_t files = 0;
  for (const Entry& entry : listUntouched(directory)) {
    if (entry.type == Entry::Type::File) ++files;
    if (entry.type == Entry::Type::Directory) files += countFiles(directory + "/" + entry.name);
  }
  return files;
}

}  // namespace

FileProgress::FileProgress(Console& console, const std::string& root) {
  if (console.isTerminal()) progress_ = std::make_unique<Progress>(console, countFiles(root));
}

FileProgress::~FileProgress() = default;

void FileProgress::advance(std::uint64_t bytes) {
  if (progress_ != nullptr) progress_->advance(bytes);
}

}  // namespace velmora::mobile::xplat::cellar::tools
