#pragma once

#include <deque>
#include <exception>
#include <memory>
#include <string>
#include <unordered_map>
#include <utility>

#include "host/MemoryTier.h"

namespace velmora::mobile::xplat::cellar::host {

// What the operation throws; null when it worked.
template <class Operation> std::exception_ptr failureOf(Operation operation) {
  try {
    operation();
    return nullptr;
  } catch (...) {
    return std::current_exception();
  }
}

// A value that several callers wait for. Joined with the tier's lock held, while it is among the tier's requests.
struct Request {
  using Value = MemoryTier::Value;

  const std::string key;
  const MemoryTier::Producer producer;  // of a computation
  std::deque<Promise<Value>> waiting;
  bool isDelivered = false;

  explicit Request(std::string key_, MemoryTier::Producer producer_ = nullptr)
      : key(std::move(key_)), producer(std::move(producer_)) {}

  Future<Value> join();

  // Called once, without a lock, when nobody can join any more. What one waiter's callback throws is thrown when all
  // have been told.
  void deliver(const Value& value, const std::exception_ptr& failure);
};

// Those that may be joined, by key. One that is removed continues for those who wait for it already.
using Requests = std::unordered_map<std::string, std::shared_ptr<Request>>;

// Removes the request. False when it was not there any more, which means that its key has changed since it began.
bool takeOut(Requests& requests, const Request& request);

}  // namespace velmora::mobile::xplat::cellar::host
