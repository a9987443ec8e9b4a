#include "demo/KeyValueClient.h"

#include <algorithm>
#include <exception>
#include <future>
#include <stdexcept>
#include <string_view>
#include <utility>

#include "ExtendedMetadata.h"
#include "host/Await.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

std::size_t digestOf(const Bytes& bytes) {
  const auto* const text = reinterpret_cast<const char*>(bytes.data());
  return std::hash<std::string_view>()({text, bytes.size()});
}

std::shared_ptr<DiskCacheItem::ExtendedMetadata> metadataOf(const KeyValueClient::Value& value) {
  if (!value.chunkSecond) return nullptr;
  return std::make_shared<VideoDownloadExtendedMetadata>(*value.chunkSecond,
                                                         VideoDownloadExtendedMetadata::ItemType::VideoChunk);
}

}  // namespace

KeyValueClient::KeyValueClient(const SourceFiles& source) : source_(source) {}

void KeyValueClient::open(std::shared_ptr<PersistentKeyValueStore> store) { store_ = std::move(store); }

void KeyValueClient::close() {
  window_ = OperationWindow();
  store_.reset();
}

bool KeyValueClient::isOpen() const { return store_ != nullptr; }

void KeyValueClient::store(const std::string& key, const Value& value) {
  const Bytes bytes = bytesOf(value);
  const Item item{value, bytes.size(), digestOf(bytes), {}, {}, ++uses_};
  items_[key] = item;
  window_.call<void>([&] { return store_->store(key, bytes, metadataOf(value)); },
                     [this, key, number = item.number](std::future<void>& result, const auto& timing) {
                       result.get();
                       storeTimes_.add(timing.took);
                       const auto stored = items_.find(key);
                       if (stored == items_.end()) return;
                       stored->second.stored = timing.dates;
                       if (stored->second.number == number) stored->second.used = timing.dates;
                     });
}

void KeyValueClient::fetch(const std::string& key) {
  const auto found = items_.find(key);
  if (found != items_.end()) found->second.number = ++uses_;
  window_.call<Fetched>([&] { return store_->fetch(key); },
                        [this, key](std::future<Fetched>& result, const auto& timing) {
                          const Fetched value = result.get();
                          fetchTimes_.add(timing.took);
                          const auto item = items_.find(key);
                          if (item != items_.end()) item->second.used = timing.dates;
                          judge(key, item == items_.end() ? std::nullopt : std::make_optional(item->second), value);
                        });
}

void KeyValueClient::fetchAll() {
  for (const std::string& key : keys()) fetch(key);
  finish();
}

void KeyValueClient::finish() { window_.finish(); }

void KeyValueClient::remove(const std::string& key) {
  finish();
  host::await(store_->removeItem(key));
  items_.erase(key);
}

void KeyValueClient::clear() {
  finish();
  const auto over = std::make_shared<std::promise<void>>();
  store_->clear([over] { over->set_value(); },
                [over](const std::exception& error) {
                  over->set_exception(std::make_exception_ptr(std::runtime_error(error.what())));
                });
  over->get_future().get();
  items_.clear();
}

std::vector<std::string> KeyValueClient::keysInStore() const {
  std::vector<std::string> keys = store_->getAllKeys();
  std::sort(keys.begin(), keys.end());
  return keys;
}

KeyValueClient::Items& KeyValueClient::items() { return items_; }

std::vector<std::string> KeyValueClient::keys() const {
  std::vector<std::string> keys;
  for (const auto& item : items_) keys.push_back(item.first);
  return keys;
}

TreeSize KeyValueClient::size() const {
  TreeSize size;
  for (const auto& item : items_) size += {1, item.second.size};
  return size;
}

std::vector<std::string> KeyValueClient::takeFaults() { return std::exchange(faults_, {}); }

std::uint64_t KeyValueClient::uses() const { return uses_; }
std::size_t KeyValueClient::hits() const { return hits_; }
std::size_t KeyValueClient::misses() const { return misses_; }
const OperationTimes& KeyValueClient::storeTimes() const { return storeTimes_; }
const OperationTimes& KeyValueClient::fetchTimes() const { return fetchTimes_; }

Bytes KeyValueClient::bytesOf(const Value& value) const {
  const SourceFiles::File& file = source_.files[value.file];
  return value.pictureBytes > 0 ? pictureOf(file, value.pictureBytes) : contentsOf(file);
}

void KeyValueClient::judge(const std::string& key, const std::optional<Item>& expected, const Fetched& result) {
  ++(result == nullptr ? misses_ : hits_);
  if (expected.has_value() != (result != nullptr)) {
    faults_.push_back(key + (expected ? " is missing" : " is there"));
  } else if (expected && result->key != key) {
    faults_.push_back(key + " came back as " + result->key);
  } else if (expected && !isRight(*expected, result->value)) {
    faults_.push_back(key + " has other bytes");
  } else if (expected && !expected->stored.includes(result->modificationDate)) {
    faults_.push_back(key + " has another date");
  }
}

// The bytes of the source file as it is now, or, should it have changed since, those that were stored.
bool KeyValueClient::isRight(const Item& expected, const Bytes& bytes) const {
  if (bytes == bytesOf(expected.value)) return true;
  return bytes.size() == expected.size && digestOf(bytes) == expected.digest;
}

}  // namespace velmora::mobile::xplat::cellar::tools
