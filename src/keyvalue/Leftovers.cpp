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

void Leftovers::removeAmong(const Files& files, std::vector<std::string> unfinished) {
  try {
    const StoreLock lock = context_.lock();
    if (context_.isInvalidated || !manifest_.get()->isLoaded()) return;
    const auto named = namesInRecords();
    std::vector<std::string> leftovers;
    for (std::string& name : unfinished) {
      if (named.count(name) == 0) leftovers.push_back(std::move(name));
    }
    const Files unknown = withoutRecord(named, files, leftovers);
    const bool isSound = unknown.empty() || isManifestSound();
    if (!isSound && context_.fileDeletion.use_count() > 1) return remove();  // theirs are removed, but not deleted yet
    if (isSound) {
      for (const auto& file : unknown) leftovers.push_back(file.name);
    } else {
      manifest_.recover(lock, ManifestCorruptedException("There are files without a record.", 0));
      for (auto file = unknown.rbegin(); file != unknown.rend(); ++file) {
        const bool isLatest = file->version.key && manifest_.get()->getItem(*file->version.key) == nullptr;
        if (isLatest) adopt(*file);
      }
    }
    deleteFiles(leftovers);
  } catch (const std::exception& error) {
    errorLine(__LINE__).stream() << "Store \"" << context_.options.name
                                 << "\" could not remove files that were left behind: " << error.what();
  }
}

std::unordered_set<std::string> Leftovers::namesInRecords() {
  const auto manifest = manifest_.get();
  std::unordered_set<std::string> names;
  for (const std::string& key : manifest->getAllKeys()) {
    const auto item = manifest->getItem(key);
    if (const auto version = VersionedName::parse(item->filename)) versions_.noteNumber(version->number);
    names.insert(item->filename);
  }
  return names;
}

// Looked at once more before it is taken for damaged: the fault may lie in the reading.
bool Leftovers::isManifestSound() {
  const auto manifest = manifest_.get();
  if (manifest->isSound()) return true;
  manifest->release();
  return manifest->isSound();
}

// Of the files that no record names, those whose key has a record with another file are superseded. The rest, whose
// key has none, is returned. A record whose own file is missing gets the latest one that there is.
Leftovers::Files Leftovers::withoutRecord(const std::unordered_set<std::string>& named, const Files& files,
                                          std::vector<std::string>& superseded) {
  const auto manifest = manifest_.get();
  Files unknown;
  for (auto file = files.rbegin(); file != files.rend(); ++file) {  // the latest first
    if (named.count(file->name) > 0) continue;
    const auto item = file->version.key ? manifest->getItem(*file->version.key) : nullptr;
    if (item == nullptr) {
      unknown.insert(unknown.begin(), *file);
    } else if (item->filename != file->name && (hasItsFile(*item) || !adopt(*file))) {
      superseded.push_back(file->name);
    }
  }
  return unknown;
}

bool Leftovers::hasItsFile(const DiskCacheItem& item) const {
  return item.hasInlineData || !VersionedName::parse(item.filename) || versions_.exists(item.filename);
}

// False for a file that is not intact, or not there any more.
bool Leftovers::adopt(const VersionedFiles::Found& file) {
  if (!versions_.exists(file.name)) return false;
  const auto size = versions_.sizeIfIntact(file);
  if (!size) return false;
  const auto manifest = manifest_.get();
  const auto date = static_cast<std::int32_t>(manifest->currentDate());
  DiskCacheItem item(*file.version.key, file.name, *size, false, date, date, nullptr);
  item.checksum = file.version.checksum;
  manifest->storeItem(item, nullptr);
  return true;
}

void Leftovers::deleteFiles(const std::vector<std::string>& names) {
  if (names.empty()) return;
  std::vector<std::string> paths;
  paths.reserve(names.size());
  for (const std::string& name : names) paths.push_back(files_.pathOf(name));
  fileQueue_.dispatch([weakThis = context_.weak(*this), deletion = context_.fileDeletion, paths = std::move(paths)] {
    const auto self = weakThis.lock();
    if (self != nullptr && !self->context_.isClosed) self->files_.deleteAll(paths);
  });
}

}  // namespace velmora::mobile::xplat::cellar
