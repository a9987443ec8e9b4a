#include "keyvalue/ValueFiles.h"

#include <cerrno>

#include "FileUtils.h"
#include "LarderException.h"
#include "keyvalue/ReservedKeys.h"
#include "keyvalue/StoreLog.h"

namespace velmora::mobile::xplat::cellar {

std::string ValueFiles::pathOf(const std::string& filename) const {
  return context_.files->combinePath(context_.options.directory, filename);
}

std::optional<std::string> ValueFiles::fileOf(const DiskCacheItem& item) const {
  if (item.hasInlineData || item.filename.empty() || isReserved(item.filename)) return std::nullopt;
  return pathOf(item.filename);
}

bool ValueFiles::exists(const std::string& key) const {
  const std::string path = pathOf(key);
  return context_.files->pathExists(path) && !context_.files->isDirectory(path);
}

void ValueFiles::deleteOne(const std::string& path) const {
  try {
    context_.files->deleteFile(path);
  } catch (const FileUtilsIoException& error) {
    if (!context_.isSafe() || error.code() != ENOENT) throw;
  }
}

void ValueFiles::deleteAll(const std::vector<std::string>& paths) const {
  for (const std::string& path : paths) {
    try {
      deleteOne(path);
    } catch (const LarderException& error) {
      errorLine(__LINE__).stream() << "Failed to delete file at \"" << path << "\" " << error.what();
    }
  }
}

void ValueFiles::deleteLeftover(const std::string& key) const {
  if (context_.isClosed) return;
  try {
    if (exists(key)) context_.files->deleteFile(pathOf(key));
  } catch (const std::exception& error) {
    errorLine(__LINE__).stream() << "Store \"" << context_.options.name
                                 << "\" could not delete the file of an unfinished write of \"" << key
                                 << "\": " << error.what();
  }
}

}  // namespace velmora::mobile::xplat::cellar
