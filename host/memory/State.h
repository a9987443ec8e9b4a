#pragma once

#include <cstdint>
#include <deque>
#include <exception>
#include <functional>
#include <future>
#include <memory>
#include <mutex>
#include <string>
#include <utility>

#include "host/MemoryTier.h"
#include "host/memory/Request.h"
#include "host/memory/SieveTable.h"

namespace velmora::mobile::xplat::cellar::host {

// Lives until nothing that the store was asked for is under way, but releases the store together with the tier.
//
// Each operation takes effect here under the lock and puts its call of the store into a queue in the same moment, so
// that the store is asked in that order, although without the lock.
class MemoryTier::State : public std::enable_shared_from_this<State> {
 public:
  State(std::shared_ptr<PersistentKeyValueStore> store, std::size_t maxBytes)
      : path_(store->path), store_(std::move(store)), table_(maxBytes) {}

  void close();
  Value find(const std::string& key);
  Future<Value> fetch(const std::string& key);
  Future<void> store(const std::string& key, const Value& value, Metadata metadata);
  Future<void> remove(const std::string& key);
  Future<void> clear();
  Future<Value> fetchOrCompute(const std::string& key, Producer producer);
  void trim(std::size_t bytes);
  Counts counts();

 private:
  using Lock = std::lock_guard<std::mutex>;
  using Store = PersistentKeyValueStore;
  using Call = std::function<void(Store&)>;
  using Write = std::function<Future<void>(Store&)>;
  class Clear;

  Value find(const Lock& lock, const std::string& key);
  void put(const Lock& lock, const std::string& key, const Value& value);
  void forget(const std::string& key);

  void makeCalls();
  Call firstCall();
  Call nextCall();

  void land(Request& flight, const Value& value, const std::exception_ptr& failure);
  Future<void> change(const Lock& lock, const std::string& key, const Value& value, Write write);
  Future<void> store(const Lock& lock, const std::string& key, const Value& value, Metadata metadata);
  void settle(const std::string& key, Promise<void>& promise, const std::exception_ptr& failure);

  void goOn(const std::shared_ptr<Request>& computation, std::future<Value>& found);
  void produce(const std::shared_ptr<Request>& computation);
  void finish(Request& computation, const Value& value, const std::exception_ptr& failure);
  void storeComputed(const Request& computation, const Value& value);

  std::exception_ptr named(const std::exception_ptr& failure, const std::string& key) const;
  static Future<Value> readyWith(Value value);

  const std::string path_;  // of the store

  std::mutex mutex_;  // guards everything below
  std::shared_ptr<Store> store_;
  SieveTable table_;
  Requests flights_;          // fetches from the store whose values may be put into memory
  Requests computations_;     // whose values may be stored
  std::size_t clearing_ = 0;  // clears that are under way
  std::deque<Call> calls_;
  bool isCalling_ = false;
  std::shared_ptr<Store> storeOfLastCalls_;  // those that were accepted before the end
  std::uint64_t hits_ = 0;
  std::uint64_t misses_ = 0;
};

}  // namespace velmora::mobile::xplat::cellar::host
