#include "AnalyticsEventReporter.h"

#include <stdexcept>
#include <utility>

#include "Clock.h"
#include "JsonValue.h"

namespace velmora::mobile::xplat::cellar {

namespace {

const std::string kCategory = "perf";
const std::string kStoreManagerEventName = "qzdiskstore_logging";
const std::string kPersistentKeyValueStoreEventName = "qzpkvs_access";
const std::string kDiskSizeCalculatorEventName = "qzdisk_size_calculator_logging";
const std::string kTrashCollectorEventName = "qztrash_collector";

const char* textOf(StoreManagerEvent::Type type) {
  switch (type) {
    case StoreManagerEvent::Type::Eviction:
      return "eviction";
    case StoreManagerEvent::Type::Initialization:
      return "initialization";
    case StoreManagerEvent::Type::Pruning:
      return "pruning";
  }
  throw std::invalid_argument("Bad Enum Value");
}

// The object of an event, member by member: given as one list, each would be built and copied twice.
class Payload {
 public:
  template <class Value> Payload& with(const char* name, const Value& value) {
    object_.emplace(name, value);
    return *this;
  }

  const JsonValue& object() const { return object_; }

 private:
  JsonValue object_ = JsonValue::object();
};

void log(XAnalytics& analytics, const std::string& eventName, const Payload& payload) {
  const std::string text = payload.object().dump(-1, ' ', false, JsonValue::error_handler_t::replace);
  analytics.logEvent(eventName, kCategory, text, std::to_string(Clock::now()));
}

}  // namespace

StoreManagerEvent::StoreManagerEvent(Type type_, std::string storeName_, unsigned int currentSize_,
                                     unsigned int maxSize_)
    : type(type_), storeName(std::move(storeName_)), currentSize(currentSize_), maxSize(maxSize_) {}

PersistentKeyValueStoreEvent::PersistentKeyValueStoreEvent(Hit hit_, std::string storeName_, std::string key_,
                                                           std::string tag_, bool hasTag_, long age_,
                                                           unsigned int size_)
    : hit(hit_),
      storeName(std::move(storeName_)),
      key(std::move(key_)),
      tag(std::move(tag_)),
      hasTag(hasTag_),
      age(age_),
      size(size_) {}

PersistentKeyValueStoreEventBuilder::PersistentKeyValueStoreEventBuilder(PersistentKeyValueStoreEvent::Hit hit,
                                                                         const std::string& storeName,
                                                                         const std::string& key)
    : event_(hit, storeName, key, "", false, 0, 0) {}

PersistentKeyValueStoreEventBuilder& PersistentKeyValueStoreEventBuilder::tag(const std::string& tag) {
  event_.tag = tag;
  event_.hasTag = true;
  return *this;
}

PersistentKeyValueStoreEventBuilder& PersistentKeyValueStoreEventBuilder::age(long seconds) {
  event_.age = seconds;
  return *this;
}

PersistentKeyValueStoreEventBuilder& PersistentKeyValueStoreEventBuilder::size(unsigned int bytes) {
  event_.size = bytes;
  return *this;
}

const PersistentKeyValueStoreEvent& PersistentKeyValueStoreEventBuilder::get() const { return event_; }

DiskSizeCalculatorEvent::DiskSizeCalculatorEvent(std::string directoryPath_, long long size_, long long fileCount_,
                                                 double processingTime_, long long diskSize_, long long freeSpace_)
    : directoryPath(std::move(directoryPath_)),
      size(size_),
      fileCount(fileCount_),
      processingTime(processingTime_),
      diskSize(diskSize_),
      freeSpace(freeSpace_) {}

TrashCollectorEvent::TrashCollectorEvent(std::chrono::milliseconds timeSpent_, unsigned long long fileCount_)
    : timeSpent(timeSpent_), fileCount(fileCount_) {}

AnalyticsEventReporter::AnalyticsEventReporter(std::unique_ptr<XAnalytics> analytics)
    : analytics_(std::move(analytics)) {}

AnalyticsEventReporter::~AnalyticsEventReporter() = default;

void AnalyticsEventReporter::reportEvent(const StoreManagerEvent& event) const {
  log(*analytics_, kStoreManagerEventName,
      Payload()
          .with("event_type", textOf(event.type))
          .with("store_name", event.storeName)
          .with("current_size", event.currentSize)
          .with("max_size", event.maxSize));
}

void AnalyticsEventReporter::reportEvent(const PersistentKeyValueStoreEvent& event) const {
  log(*analytics_, kPersistentKeyValueStoreEventName,
      Payload()
          .with("store_name", event.storeName)
          .with("key", event.key)
          .with("tag", event.hasTag ? event.tag : std::string())
          .with("hit", static_cast<int>(event.hit))
          .with("itemAge", event.age)
          .with("size", event.size));
}

void AnalyticsEventReporter::reportEvent(const DiskSizeCalculatorEvent& event) const {
  log(*analytics_, kDiskSizeCalculatorEventName,
      Payload()
          .with("directory_path", event.directoryPath)
          .with("size", event.size)
          .with("file_count", event.fileCount)
          .with("processing_time", event.processingTime)
          .with("disk_size", event.diskSize)
          .with("free_space", event.freeSpace));
}

void AnalyticsEventReporter::reportEvent(const TrashCollectorEvent& event) const {
  log(*analytics_, kTrashCollectorEventName,
      Payload()
          .with("time_spent", static_cast<double>(event.timeSpent.count()) / 1000.0)
          .with("file_count", event.fileCount));
}

}  // namespace velmora::mobile::xplat::cellar
