#include "host/MemoryTier.h"

#include <stdexcept>
#include <utility>

#include "host/memory/State.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

using Value = MemoryTier::Value;

std::shared_ptr<PersistentKeyValueStore> checked(std::shared_ptr<PersistentKeyValueStore> store) {
  if (store == nullptr) throw std::invalid_argument("A memory tier needs a store.");
  return store;
}

}  // namespace

MemoryTier::MemoryTier(std::shared_ptr<PersistentKeyValueStore> store, std::size_t maxBytes)
    : state_(std::make_shared<State>(checked(std::move(store)), maxBytes)) {}

MemoryTier::~MemoryTier() { state_->close(); }

Value MemoryTier::find(const std::string& key) { return state_->find(key); }

// Each call keeps the state alive: a callback may destroy the tier.
Future<Value> MemoryTier::fetch(const std::string& key) { return std::shared_ptr<State>(state_)->fetch(key); }

Future<void> MemoryTier::store(const std::string& key, Bytes bytes, Metadata metadata) {
  return store(key, std::make_shared<const Bytes>(std::move(bytes)), std::move(metadata));
}

Future<void> MemoryTier::store(const std::string& key, const Value& value, Metadata metadata) {
  if (value == nullptr) throw std::invalid_argument("A memory tier stores no null value.");
  return std::shared_ptr<State>(state_)->store(key, value, std::move(metadata));
}

Future<void> MemoryTier::remove(const std::string& key) { return std::shared_ptr<State>(state_)->remove(key); }

Future<void> MemoryTier::clear() { return std::shared_ptr<State>(state_)->clear(); }

Future<Value> MemoryTier::fetchOrCompute(const std::string& key, Producer producer) {
  return std::shared_ptr<State>(state_)->fetchOrCompute(key, std::move(producer));
}

void MemoryTier::trim(std::size_t bytes) { state_->trim(bytes); }

MemoryTier::Counts MemoryTier::counts() const { return state_->counts(); }

}  // namespace velmora::mobile::xplat::cellar::host
