#include "keyvalue/InlineWriter.h"

#include <cstddef>
#include <cstdint>
#include <exception>
#include <utility>

#include "Clock.h"
#include "keyvalue/Clearing.h"
#include "keyvalue/GroupCommit.h"
#include "keyvalue/ItemRemover.h"
#include "keyvalue/ManifestChange.h"
#include "keyvalue/Rollback.h"
#include "keyvalue/StoreManifest.h"
#include "keyvalue/ValueFiles.h"
#include "keyvalue/WritesInFlight.h"

namespace velmora::mobile::xplat::cellar {

// A value, on its way through the queues.
struct InlineWriter::Value final : ManifestChange, std::enable_shared_from_this<Value> {
  const std::string key;
  const std::vector<unsigned char> data;
  const std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata;
  const std::weak_ptr<InlineWriter> owner;
  const Token operation;
  Promise<void> promise;

  std::unique_ptr<DiskCacheItem> evicted;     // for it, in a group
  std::optional<ReplacedItem> replaced;       // by its record
  std::optional<std::string> replacedFile{};  // the path of the file that held the value so far
  std::optional<std::uint32_t> total;         // of all items with this one, to report

  Value(const std::string& key_, std::vector<unsigned char> data_,
        std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata_, std::weak_ptr<InlineWriter> owner_,
        Token operation_)
      : key(key_),
        data(std::move(data_)),
        extendedMetadata(std::move(extendedMetadata_)),
        owner(std::move(owner_)),
        operation(std::move(operation_)) {}

  std::size_t bytes() const override { return data.size(); }

  // Whoever runs a write holds the store.
  void runAlone() override { owner.lock()->writeAlone(*this); }
  void change(const StoreLock& lock) override {
    const auto writer = owner.lock();
    evicted = writer->remover_.takeOldestIfFull(lock);
    writer->setRow(*this);
    total = writer->manifest_.totalToReport();
  }
  void note(const StoreLock& lock) override {
    const auto writer = owner.lock();
    writer->remover_.noteEvicted(lock, evicted.get());
    writer->noteRow(lock, *this);
  }
  void finish() override { owner.lock()->fulfil(*this); }
};

Future<void> InlineWriter::store(const std::string& key, std::vector<unsigned char> data,
                                 std::shared_ptr<DiskCacheItem::ExtendedMetadata> extendedMetadata) {
  return groupCommit_.submit(std::make_shared<Value>(key, std::move(data), std::move(extendedMetadata),
                                                     context_.weak(*this), context_.operation));
}

void InlineWriter::writeAlone(Value& value) {
  try {
    const StoreLock lock = context_.lock();
    context_.throwIfInvalid();
    if (writeRow(lock, value)) {
      noteRow(lock, value);
    } else {
      writes_.revoke(value.key);
    }
    value.total = manifest_.totalToReport();
  } catch (...) {
    return value.promise.setException(std::current_exception());
  }
  fulfil(value);
}

// False when the store had to be purged instead.
bool InlineWriter::writeRow(const StoreLock& lock, Value& value) {
  value.replaced.reset();
  try {
    return remover_.makeRoom(lock) && manifest_.recoveringFromFailedWrite(lock, [&] { setRow(value); });
  } catch (...) {
    if (value.replaced) takeBack(lock, value.key, std::move(*value.replaced));
    throw;
  }
}

void InlineWriter::setRow(Value& value) {
  const auto manifest = manifest_.get();
  const auto date = static_cast<std::int32_t>(Clock::now());
  const auto size = static_cast<std::uint32_t>(value.data.size());
  value.replaced =
      manifest->replaceItem({value.key, value.key, size, false, date, date, value.extendedMetadata}, false);
  manifest->setInlineData(value.key, value.data);
}

void InlineWriter::noteRow(const StoreLock& lock, Value& value) {
  StoreContext::count(context_.stores);
  clearing_.noteStored(lock, value.key);
  if (value.replaced && value.replaced->item != nullptr) value.replacedFile = files_.fileOf(*value.replaced->item);
}

void InlineWriter::fulfil(Value& value) {
  if (value.failure != nullptr) return value.promise.setException(value.failure);
  try {
    if (value.total) manifest_.dispatchReport(*value.total);
  } catch (...) {
    return value.promise.setException(std::current_exception());
  }
  if (value.replacedFile) return deleteReplacedFile(*value.replacedFile, value.shared_from_this());
  value.promise.setValue();
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
