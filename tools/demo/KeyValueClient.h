#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "PersistentKeyValueStore.h"
#include "demo/DateRange.h"
#include "demo/FileContents.h"
#include "demo/OperationTimes.h"
#include "demo/OperationWindow.h"
#include "demo/SourceFiles.h"
#include "demo/Trees.h"

namespace velmora::mobile::xplat::cellar::tools {

// A store with keys as its host uses it: many operations under way at once, each of them timed, and what comes back
// compared byte for byte with the file that it came from. Knows by itself what the store should hold.
class KeyValueClient {
 public:
  // A value to be stored.
  struct Value {
    std::size_t file;                               // number of the source file
    std::size_t pictureBytes = 0;                   // not 0: a picture of that size, made of the file
    std::optional<int> chunkSecond = std::nullopt;  // of the video that it is a chunk of
  };

  // One that has been stored and should be there.
  struct Item {
    Value value;
    std::uint64_t size;
    std::size_t digest;
    DateRange stored;
    DateRange used;        // for the last time
    std::uint64_t number;  // of the last use among all uses of the store
  };

  using Items = std::map<std::string, Item>;

  // `source` outlives this.
  explicit KeyValueClient(const SourceFiles& source);

  // Uses that store from now on.
  void open(std::shared_ptr<PersistentKeyValueStore> store);

  // Lets the store go, and does not look at the results of what is under way.
  void close();

  bool isOpen() const;

  // Begin an operation. Results are dealt with during later calls.
  void store(const std::string& key, const Value& value);
  void fetch(const std::string& key);
  void fetchAll();

  // Waits for what is under way. Throws what one of the operations has failed with.
  void finish();

  // Removes the item and waits for it.
  void remove(const std::string& key);

  // Removes all items and waits for it.
  void clear();

  std::vector<std::string> keysInStore() const;

  // What should be there. Whoever knows that something has gone takes it out.
  Items& items();
  std::vector<std::string> keys() const;
  TreeSize size() const;

  // What came back other than it should, a line for each, since the last call.
  std::vector<std::string> takeFaults();

  std::uint64_t uses() const;
  std::size_t hits() const;
  std::size_t misses() const;
  const OperationTimes& storeTimes() const;
  const OperationTimes& fetchTimes() const;

 private:
  using Fetched = std::unique_ptr<PersistentKeyValueStore::FetchResult>;

  Bytes bytesOf(const Value& value) const;
  void judge(const std::string& key, const std::optional<Item>& expected, const Fetched& result);
  bool isRight(const Item& expected, const Bytes& bytes) const;

  const SourceFiles& source_;
  std::shared_ptr<PersistentKeyValueStore> store_;
  OperationWindow window_;
  Items items_;
  std::vector<std::string> faults_;
  std::uint64_t uses_ = 0;
  std::size_t hits_ = 0;
  std::size_t misses_ = 0;
  OperationTimes storeTimes_;
  OperationTimes fetchTimes_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
