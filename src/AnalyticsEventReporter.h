#pragma once

#include <chrono>
#include <memory>
#include <string>

#include "Export.h"
#include "XAnalytics.h"

namespace velmora::mobile::xplat::cellar {

// What a manager did with one of its stores.
struct CELLAR_EXPORT StoreManagerEvent {
  enum class Type : int { Eviction = 0, Initialization = 1, Pruning = 2 };

  StoreManagerEvent(Type type, std::string storeName, unsigned int currentSize, unsigned int maxSize);

  Type type;
  std::string storeName;
  unsigned int currentSize;  // bytes, at that time
  unsigned int maxSize;      // bytes, the limit that applies
};

// An access to a key of a store.
struct CELLAR_EXPORT PersistentKeyValueStoreEvent {
  enum class Hit : int { Found = 0, Missing = 1 };  // the number is what is reported

  PersistentKeyValueStoreEvent(Hit hit, std::string storeName, std::string key, std::string tag, bool hasTag, long age,
                               unsigned int size);

  Hit hit;
  std::string storeName;
  std::string key;
  std::string tag;  // means something only when `hasTag`
  bool hasTag;
  long age;           // seconds since the item was written; 0 for a missing one
  unsigned int size;  // bytes of the item; 0 for a missing one
};

// Builds the event of an access, step by step.
class CELLAR_EXPORT PersistentKeyValueStoreEventBuilder {
 public:
  PersistentKeyValueStoreEventBuilder(PersistentKeyValueStoreEvent::Hit hit, const std::string& storeName,
                                      const std::string& key);

  PersistentKeyValueStoreEventBuilder& tag(const std::string& tag);
  PersistentKeyValueStoreEventBuilder& age(long seconds);
  PersistentKeyValueStoreEventBuilder& size(unsigned int bytes);

  // The event as built so far. Lives as long as the builder.
  const PersistentKeyValueStoreEvent& get() const;

 private:
  PersistentKeyValueStoreEvent event_;
};

// The result of measuring a directory, or a single large file.
struct CELLAR_EXPORT DiskSizeCalculatorEvent {
  DiskSizeCalculatorEvent(std::string directoryPath, long long size, long long fileCount, double processingTime,
                          long long diskSize, long long freeSpace);

  std::string directoryPath;
  long long size;  // bytes
  long long fileCount;
  double processingTime;  // seconds
  long long diskSize;     // bytes of the file system that holds it
  long long freeSpace;    // bytes still available there
};

// One emptying of the trash.
struct CELLAR_EXPORT TrashCollectorEvent {
  TrashCollectorEvent(std::chrono::milliseconds timeSpent, unsigned long long fileCount);

  std::chrono::milliseconds timeSpent;
  unsigned long long fileCount;  // files and directories removed
};

// Turns events into calls on the host's sink, which it owns. Holds no mutable state and takes no lock: any thread may
// report, and the sink is called on that thread. Text that is not UTF-8 is reported with replacement characters. What
// the sink throws passes through.
class CELLAR_EXPORT AnalyticsEventReporter {
 public:
  explicit AnalyticsEventReporter(std::unique_ptr<XAnalytics> analytics);
  virtual ~AnalyticsEventReporter();

  // Throws `std::invalid_argument` for a type that is none of the three; nothing is reported then.
  virtual void reportEvent(const StoreManagerEvent& event) const;
  virtual void reportEvent(const PersistentKeyValueStoreEvent& event) const;
  virtual void reportEvent(const DiskSizeCalculatorEvent& event) const;
  virtual void reportEvent(const TrashCollectorEvent& event) const;

 private:
  std::unique_ptr<XAnalytics> analytics_;
};

}  // namespace velmora::mobile::xplat::cellar
