#include "keyvalue/InlineWriter.h"

#include <cstdint>
#include <exception>
#include <utility>

#include "Clock.h"
#include "keyvalue/Clearing.h"
#include "keyvalue/ItemRemover.h"
#include "keyvalue/Rollback.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/ValueFiles.h"
#include "keyvalue/WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

// A value, on its way through the queues.
struct InlineWriter::Value {
  const std::string key;
  const std::vector<unsigned char> data;
  std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata;
  const Token operation;
  Promise<void> promise;

  Value(const std::string& key_, std::vector<unsigned char> data_,
        std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata_, Token operation_)
      : key(key_),
        data(std::move(data_)),
        extendedMetadata(std::move(extendedMetadata_)),
        operation(std::move(operation_)) {}
};

Future<void> InlineWriter::store(const std::string& key, std::vector<unsigned char> data,
                                 std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata) {
  const auto value = std::make_shared<Value>(key, std::move(data), std::move(extendedMetadata), context_.operation);
  Future<void> future = value->promise.getFuture();
  context_.dispatchWork(KeyRange(value->key), value->promise, [weakThis = context_.weak(*this), value] {
    if (const auto self = weakThis.lock()) {
      self->write(value);
    } else {
      value->promise.setValue();
    }
  });
  return future;
}

void InlineWriter::write(const std::shared_ptr<Value>& value) {
  std::optional<std::string> replacedFile;
  try {
    const StoreLock lock = context_.lock();
    context_.throwIfInvalid();
    replacedFile = writeRow(lock, *value);
  } catch (...) {
    return value->promise.setException(std::current_exception());
  }
  if (replacedFile) {
    deleteReplacedFile(*replacedFile, value);
  } else {
    value->promise.setValue();
  }
}

// The path of the file that held the value so far, if one did.
std::optional<std::string> InlineWriter::writeRow(const StoreLock& lock, Value& value) {
  std::optional<ReplacedItem> replaced;
  const auto writeIt = [&] {
    const auto manifest = manifest_.get();
    const auto date = static_cast<std::int32_t>(Clock::now());
    const auto size = static_cast<std::uint32_t>(value.data.size());
    replaced = manifest->replaceItem({value.key, value.key, size, false, date, date, std::move(value.extendedMetadata)},
                                     false);
    manifest->setInlineData(value.key, value.data);
    StoreContext::count(context_.stores);
  };
  bool isWritten = false;
  try {
    isWritten = remover_.makeRoom(lock) && manifest_.purgingIfUnwritable(lock, writeIt);
  } catch (...) {
    if (replaced) takeBack(lock, value.key, std::move(*replaced));
    throw;
  }
  manifest_.reportSize();
  if (!isWritten) {
    writes_.revoke(value.key);
    return std::nullopt;
  }
  clearing_.noteStored(lock, value.key);
  return replaced && replaced->item != nullptr ? files_.fileOf(*replaced->item) : std::nullopt;
}

// A record whose bytes could not be written must not be left: the value in a file is back then, an inline one is gone.
void InlineWriter::takeBack(const StoreLock& lock, const std::string& key, ReplacedItem replaced) {
  SettledValue settled;
  if (replaced.item != nullptr && !replaced.item->hasInlineData) settled.record = std::move(replaced.item);
  rollback_.tryToRestore(lock, key, settled);
}

// On the file queue, behind the fetches that wait for the file. The promise waits too: as long as the file is there, a
// kill in the middle of the next write of the key could bring its value back.
void InlineWriter::deleteReplacedFile(const std::string& path, const std::shared_ptr<Value>& value) {
  const auto deleteIt = [weakThis = context_.weak(*this), deletion = context_.fileDeletion, path, value] {
    const auto self = weakThis.lock();
    if (self != nullptr && !self->context_.isClosed) self->files_.deleteAll({path});
    value->promise.setValue();
  };
  try {
    context_.fileQueue->dispatch(deleteIt);
  } catch (...) {
    deleteIt();
  }
}

}  // namespace velmora::mobile::xplat::cellar
