#include <glog/logging.h>

#include <cellar/LarderException.h>
#include <cellar/host/Errors.h>

#include "host/errors/Texts.h"
#include "host/memory/State.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

using Value = MemoryTier::Value;

// Whether the store itself has failed, not a callback or one of its queues.
bool isOfTheLibrary(const std::exception_ptr& failure) {
  try {
    std::rethrow_exception(failure);
  } catch (const LarderException&) {
    return true;
  } catch (...) {
    return false;
  }
}

}  // namespace

Future<Value> MemoryTier::State::fetchOrCompute(const std::string& key, Producer producer) {
  std::shared_ptr<Request> computation;
  Future<Value> future;
  {
    const Lock lock(mutex_);
    if (Value value = find(lock, key)) return readyWith(std::move(value));
    const auto present = computations_.find(key);
    if (present != computations_.end()) {
      ++misses_;
      return present->second->join();
    }
    computation = std::make_shared<Request>(key, std::move(producer));
    future = computation->join();
    computations_.emplace(key, computation);
  }
  fetch(key).then(
      nullptr, [self = shared_from_this(), computation](std::future<Value>& found) { self->goOn(computation, found); });
  return future;
}

// With what the store has.
void MemoryTier::State::goOn(const std::shared_ptr<Request>& computation, std::future<Value>& found) {
  Value value;
  try {
    value = found.get();
  } catch (const StoreError& error) {
    const bool isUnreadable = isOfTheLibrary(error.nested_ptr());  // or the store refuses the key
    if (!isUnreadable) return finish(*computation, nullptr, std::current_exception());
    LOG(ERROR) << "The value of " << shown(computation->key) << " is computed again: " << error.what();
  } catch (...) {  // an invalid store, or a queue that is shut down
    return finish(*computation, nullptr, std::current_exception());
  }
  value != nullptr ? finish(*computation, value, nullptr) : produce(computation);
}

// What fails is the producer, or, when it was so quick that the value is delivered, a callback of a waiter.
void MemoryTier::State::produce(const std::shared_ptr<Request>& computation) {
  try {
    computation->producer().then(nullptr, [self = shared_from_this(), computation](std::future<Bytes>& result) {
      Value value;
      const auto failure = failureOf([&] { value = std::make_shared<const Bytes>(result.get()); });
      if (failure == nullptr) self->storeComputed(*computation, value);
      self->finish(*computation, value, failure);
    });
  } catch (...) {
    if (computation->isDelivered) throw;
    finish(*computation, nullptr, std::current_exception());
  }
}

void MemoryTier::State::storeComputed(const Request& computation, const Value& value) {
  Future<void> stored;
  {
    const Lock lock(mutex_);
    if (!takeOut(computations_, computation)) return;
    stored = store(lock, computation.key, value, nullptr);
  }
  stored.then(nullptr, [key = computation.key](std::future<void>& result) {
    const auto failure = failureOf([&] { result.get(); });
    if (failure == nullptr) return;
    LOG(ERROR) << "The computed value of " << shown(key) << " is not stored: " << textOf(failure);
  });
  makeCalls();
}

void MemoryTier::State::finish(Request& computation, const Value& value, const std::exception_ptr& failure) {
  {
    const Lock lock(mutex_);
    takeOut(computations_, computation);
  }
  computation.deliver(value, failure);
}

}  // namespace velmora::mobile::xplat::cellar::host
