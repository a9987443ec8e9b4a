#include "keyvalue/Leftovers.h"

#include <cstdint>
#include <exception>
#include <unordered_set>
#include <utility>

#include "DiskCacheManifest.h"
#include "LarderException.h"
#include "keyvalue/FileQueue.h"
#include "keyvalue/StoreLog.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/ValueFiles.h"

namespace velmora::mobile::xplat::cellar {

void Leftovers::remove() {
  fileQueue_.dispatch([weakThis = context_.weak(*this), operation = context_.operation] {
    if (const auto self = weakThis.lock()) self->list();
  });
}

void Leftovers::list() {
  if (context_.isInvalidated) return;
  try {
    context_.workQueue->dispatch([weakThis = context_.weak(*this), operation = context_.operation,
                                  files = versions_.found(), unfinished = versions_.unfinished()] {
      if (const auto self = weakThis.lock()) self->removeAmong(files, unfinished);
    });
  } catch (const std::exception& error) {
    errorLine(__LINE__).stream() << "Store \"" << context_.options.name
                                 << "\" could not look for files that were left behind: " << error.what();
  }
}

void Leftovers::removeAmong(const Files& files, std::vector<std::string> leftovers) {
  try {
    const StoreLock lock = context_.lock();
    if (context_.isInvalidated || !manifest_.get()->isLoaded()) return;
    const Files unknown = withoutRecord(*manifest_.get(), files, leftovers);
    if (unknown.empty() || manifest_.get()->isSound()) {
      for (const auto& file : unknown) leftovers.push_back(file.name);
    } else {
      manifest_.recover(lock, ManifestCorruptedException("There are files without a record.", 0));
      for (auto file = unknown.rbegin(); file != unknown.rend(); ++file) {
        const bool isLatest = file->version.key && manifest_.get()->getItem(*file->version.key) == nullptr;
        if (isLatest) adopt(*manifest_.get(), *file);
      }
    }
  } catch (const std::exception& error) {
    errorLine(__LINE__).stream() << "Store \"" << context_.options.name
                                 << "\" could not tell which files were left behind: " << error.what();
    return;
  }
  deleteFiles(leftovers);
}

// Of the files that no record names, those whose key has a record with another file are superseded. The rest, whose
// key has none, is returned. A record whose own file is missing gets the latest one that there is.
Leftovers::Files Leftovers::withoutRecord(DiskCacheManifestInterface& manifest, const Files& files,
                                          std::vector<std::string>& superseded) {
  std::unordered_set<std::string> present;
  for (const auto& file : files) present.insert(file.name);
  std::unordered_set<std::string> named;  // by the records of keys that are too long for a file name
  for (const std::string& key : manifest.getAllKeys()) {
    const auto version = VersionedName::parse(manifest.getItem(key)->filename);
    if (version && !version->key) named.insert(manifest.getItem(key)->filename);
  }
  Files unknown;
  for (auto file = files.rbegin(); file != files.rend(); ++file) {  // the latest first
    if (named.count(file->name) > 0) continue;
    const auto item = file->version.key ? manifest.getItem(*file->version.key) : nullptr;
    if (item == nullptr) {
      unknown.insert(unknown.begin(), *file);
    } else if (item->filename != file->name) {
      const bool isMissing =
          !item->hasInlineData && VersionedName::parse(item->filename) && present.count(item->filename) == 0;
      if (!isMissing || !adopt(manifest, *file)) superseded.push_back(file->name);
    }
  }
  return unknown;
}

// False for a file that is not intact.
bool Leftovers::adopt(DiskCacheManifestInterface& manifest, const VersionedFiles::Found& file) {
  const auto size = versions_.sizeIfIntact(file);
  if (!size) return false;
  const auto date = static_cast<std::int32_t>(manifest.currentDate());
  DiskCacheItem item(*file.version.key, file.name, *size, false, date, date, nullptr);
  item.checksum = file.version.checksum;
  manifest.storeItem(item, nullptr);
  return true;
}

void Leftovers::deleteFiles(const std::vector<std::string>& names) {
  if (names.empty()) return;
  std::vector<std::string> paths;
  for (const std::string& name : names) paths.push_back(files_.pathOf(name));
  fileQueue_.dispatch([weakThis = context_.weak(*this), deletion = context_.fileDeletion, paths = std::move(paths)] {
    const auto self = weakThis.lock();
    if (self != nullptr && !self->context_.isClosed) self->files_.deleteAll(paths);
  });
}

}  // namespace velmora::mobile::xplat::cellar
