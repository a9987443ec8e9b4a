#include "host/memory/State.h"

#include <glog/logging.h>

#include <atomic>
#include <stdexcept>

#include <cellar/LarderException.h>
#include <cellar/host/Errors.h>

#include "host/errors/Texts.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

using Value = MemoryTier::Value;
using Fetched = std::unique_ptr<PersistentKeyValueStore::FetchResult>;

}  // namespace

// A clear of the store that is under way: until one of its callbacks is called, or the store has dropped both.
class MemoryTier::State::Clear {
 public:
  explicit Clear(std::shared_ptr<State> state) : state_(std::move(state)) {}
  Clear(const Clear&) = delete;
  Clear& operator=(const Clear&) = delete;
  ~Clear() {
    try {
      end(std::make_exception_ptr(std::future_error(std::future_errc::broken_promise)));
    } catch (...) {
      LOG(ERROR) << "A callback of a clear has thrown: " << currentText();
    }
  }

  Future<void> future() { return promise_.getFuture(); }

  void end(const std::exception_ptr& failure) {
    if (isOver_.exchange(true)) return;
    {
      const Lock lock(state_->mutex_);
      --state_->clearing_;
    }
    failure ? promise_.setException(state_->named(failure, "")) : promise_.setValue();
  }

 private:
  const std::shared_ptr<State> state_;
  Promise<void> promise_;
  std::atomic<bool> isOver_{false};
};

// The value first, while nobody else can have the future: the lock that is held is not held around the future's own.
Future<Value> MemoryTier::State::readyWith(Value value) {
  Promise<Value> promise;
  promise.setValue(std::move(value));
  return promise.getFuture();
}

// The store's failure, null for none, with its culprit.
std::exception_ptr MemoryTier::State::named(const std::exception_ptr& failure, const std::string& key) const {
  return failure == nullptr ? nullptr : detail::named(failure, path_, key);
}

// --- Memory ---

Value MemoryTier::State::find(const std::string& key) {
  const Lock lock(mutex_);
  return find(lock, key);
}

Value MemoryTier::State::find(const Lock& /*lock*/, const std::string& key) {
  Value value = table_.find(key);
  if (value == nullptr) return nullptr;
  try {
    store_->throwIfInvalid();
  } catch (const InvalidatedException&) {
    table_.clear();
    return nullptr;
  }
  ++hits_;
  return value;
}

void MemoryTier::State::put(const Lock& /*lock*/, const std::string& key, const Value& value) {
  if (store_ != nullptr && clearing_ == 0) table_.put(key, value);
}

void MemoryTier::State::forget(const std::string& key) {
  const Lock lock(mutex_);
  table_.erase(key);
}

void MemoryTier::State::trim(std::size_t bytes) {
  const Lock lock(mutex_);
  bytes == 0 ? table_.clear() : table_.trim(bytes);
}

MemoryTier::Counts MemoryTier::State::counts() {
  const Lock lock(mutex_);
  return {hits_, misses_, table_.size(), table_.bytes()};
}

// The calls that still wait, and their promises, end without the lock.
void MemoryTier::State::close() {
  std::shared_ptr<Store> store;
  const Lock lock(mutex_);
  store = std::exchange(store_, nullptr);
  if (isCalling_) storeOfLastCalls_ = store;  // what has been accepted is still done
  table_.clear();
  flights_.clear();
  computations_.clear();
}

// --- The store, asked in order ---

// One thread at a time: another one's calls are made by the thread that is at it already.
void MemoryTier::State::makeCalls() {
  for (Call call = firstCall(); call; call = nextCall()) {
    std::shared_ptr<Store> store;
    {
      const Lock lock(mutex_);
      store = store_ != nullptr ? store_ : storeOfLastCalls_;
    }
    if (store == nullptr) continue;
    const auto failure = failureOf([&] { call(*store); });
    if (failure != nullptr) LOG(ERROR) << "A callback of a fetch or a change failed: " << textOf(failure);
  }
}

MemoryTier::State::Call MemoryTier::State::firstCall() {
  {
    const Lock lock(mutex_);
    if (isCalling_) return nullptr;
    isCalling_ = true;
  }
  return nextCall();
}

MemoryTier::State::Call MemoryTier::State::nextCall() {
  std::shared_ptr<Store> released;  // without the lock
  const Lock lock(mutex_);
  isCalling_ = !calls_.empty();
  if (!isCalling_) {
    released = std::exchange(storeOfLastCalls_, nullptr);
    return nullptr;
  }
  Call call = std::move(calls_.front());
  calls_.pop_front();
  return call;
}

// --- Fetching ---

Future<Value> MemoryTier::State::fetch(const std::string& key) {
  Future<Value> future;
  {
    const Lock lock(mutex_);
    if (Value value = find(lock, key)) return readyWith(std::move(value));
    ++misses_;
    const auto present = flights_.find(key);
    if (present != flights_.end()) return present->second->join();
    const auto flight = std::make_shared<Request>(key);
    future = flight->join();
    if (clearing_ == 0) flights_.emplace(key, flight);
    calls_.emplace_back([this, flight](Store& store) {
      Future<Fetched> fetched;
      const auto refusal = failureOf([&] { fetched = store.fetch(flight->key); });
      if (refusal != nullptr) return land(*flight, nullptr, named(refusal, flight->key));
      fetched.then(nullptr, [self = shared_from_this(), flight](std::future<Fetched>& result) {
        Value value;
        const auto failure = failureOf([&] {
          const Fetched found = result.get();
          if (found != nullptr) value = std::make_shared<const Bytes>(std::move(found->value));
        });
        self->land(*flight, value, self->named(failure, flight->key));
      });
    });
  }
  makeCalls();
  return future;
}

void MemoryTier::State::land(Request& flight, const Value& value, const std::exception_ptr& failure) {
  {
    const Lock lock(mutex_);
    if (takeOut(flights_, flight) && value != nullptr) put(lock, flight.key, value);
  }
  flight.deliver(value, failure);
}

// --- Changing ---

// A null value removes the key. The caller lets the calls be made.
Future<void> MemoryTier::State::change(const Lock& lock, const std::string& key, const Value& value, Write write) {
  flights_.erase(key);
  computations_.erase(key);
  value != nullptr ? put(lock, key, value) : table_.erase(key);
  const auto promise = std::make_shared<Promise<void>>();
  calls_.emplace_back([this, key, promise, write = std::move(write)](Store& store) {
    Future<void> written;
    const auto refusal = failureOf([&] { written = write(store); });
    if (refusal != nullptr) return settle(key, *promise, refusal);
    written.then(nullptr, [self = shared_from_this(), key, promise](std::future<void>& result) {
      self->settle(key, *promise, failureOf([&] { result.get(); }));
    });
  });
  return promise->getFuture();
}

void MemoryTier::State::settle(const std::string& key, Promise<void>& promise, const std::exception_ptr& failure) {
  if (failure == nullptr) return promise.setValue();
  forget(key);
  promise.setException(named(failure, key));
}

Future<void> MemoryTier::State::store(const Lock& lock, const std::string& key, const Value& value, Metadata metadata) {
  const auto write = [key, value, metadata = std::move(metadata)](Store& store) {
    return store.store(key, *value, metadata);
  };
  return change(lock, key, value, write);
}

Future<void> MemoryTier::State::store(const std::string& key, const Value& value, Metadata metadata) {
  Future<void> future;
  {
    const Lock lock(mutex_);
    future = store(lock, key, value, std::move(metadata));
  }
  makeCalls();
  return future;
}

Future<void> MemoryTier::State::remove(const std::string& key) {
  Future<void> future;
  {
    const Lock lock(mutex_);
    future = change(lock, key, nullptr, [key](Store& store) { return store.removeItem(key); });
  }
  makeCalls();
  return future;
}

Future<void> MemoryTier::State::clear() {
  const auto clear = std::make_shared<Clear>(shared_from_this());
  Future<void> future = clear->future();
  {
    const Lock lock(mutex_);
    table_.clear();
    flights_.clear();
    computations_.clear();
    ++clearing_;
    calls_.emplace_back([clear](Store& store) {
      const auto onError = [clear](const std::exception& error) {
        const auto failure = std::current_exception();
        clear->end(failure ? failure : std::make_exception_ptr(std::runtime_error(error.what())));
      };
      const auto refusal = failureOf([&] { store.clear([clear] { clear->end(nullptr); }, onError); });
      if (refusal != nullptr) clear->end(refusal);
    });
  }
  makeCalls();
  return future;
}

}  // namespace velmora::mobile::xplat::cellar::host
