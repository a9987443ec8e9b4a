#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "DiskCacheItem.h"
#include "Export.h"

namespace velmora::mobile::xplat::cellar {

// The durable half of a manifest: one record per key, and beside it, where an item has one, its inline value. Any
// thread may call; operations take effect one after the other, each before it returns. Every operation but `invalidate`
// throws ManifestPersistenceException when the medium fails, and ManifestCorruptedException when what lies on it is
// damaged or foreign. After `invalidate` each of them does nothing and returns the empty result. Not an error anywhere:
// a key without a record.
class CELLAR_EXPORT ManifestPersistence {
 public:
  virtual ~ManifestPersistence();

  // Starts again on a fresh medium. The caller has removed the old one: records on a medium that is still there stay.
  virtual void clearItems() = 0;

  // Replaces the whole record of the item's key, and with it drops the inline value.
  virtual void setItem(const DiskCacheItem& item) = 0;

  // The caller's own copy; null when there is none.
  virtual std::unique_ptr<DiskCacheItem> getItem(const std::string& key) const = 0;

  virtual void removeItem(const std::string& key) = 0;

  // `date` in seconds since the Unix epoch.
  virtual void updateLastAccessDate(const std::string& key, long date) = 0;

  // Items last used strictly before `date`, in no particular order.
  virtual std::vector<std::unique_ptr<DiskCacheItem>> getItemsLastAccessedBefore(long date) const = 0;

  // Lets go of the medium for good.
  virtual void invalidate() = 0;

  virtual std::vector<std::unique_ptr<DiskCacheItem>> getAllItems() const = 0;

  // Empty when the key has no record, or one that is not marked as inline.
  virtual std::vector<unsigned char> getInlineData(const std::string& key) const = 0;

  // Adds the value to a record that is there already and marks it as inline; its size and dates stay as they are.
  virtual void setInlineData(const std::string& key, const std::vector<unsigned char>& data) = 0;

  // Drops the value and the mark; the record stays.
  virtual void removeInlineData(const std::string& key) = 0;

  // Runs `operations`, which call this persistence, so that they take effect together: all of them when it returns
  // true, none when it throws, be it what they have thrown or that they could not be completed. Other threads'
  // operations wait. False, and nothing was run, when this persistence cannot do it, as here, or has been invalidated.
  // Not nested.
  virtual bool performTogether(const std::function<void()>& operations);

  // Replaces the whole record of the item's key, its checksum and its inline value (null: none) included. Here in two
  // operations, and without the checksum.
  virtual void storeItem(const DiskCacheItem& item, const std::vector<unsigned char>* inlineData);

  // Whether the medium is not the one any more that its path leads to: somebody has removed or replaced it.
  virtual bool hasMoved() const;

  // Whether nothing is found wrong with the medium when all of it is read. Here: true.
  virtual bool isSound() const;

  // Lets go of the medium until the next operation.
  virtual void release();

  // The same until `resume`: operations fail meanwhile.
  virtual void suspend();
  virtual void resume();

 protected:
  ManifestPersistence() = default;
  ManifestPersistence(const ManifestPersistence&) = default;
  ManifestPersistence& operator=(const ManifestPersistence&) = default;
};

}  // namespace velmora::mobile::xplat::cellar
