#pragma once

#include <cstddef>
#include <memory>
#include <mutex>
#include <string>
#include <unordered_map>
#include <utility>
#include <vector>

#include "keyvalue/KeyRange.h"

namespace velmora::mobile::xplat::cellar {

// The keys of operations that reach the work queue by way of the file queue: those behind them have to go the same way,
// so that the operations on a key take effect in the order in which they were called. One without keys is about all of
// them. Any thread may call.
class KeysAhead {
  struct State;

 public:
  // An operation on its way, until it is destroyed.
  class Passage {
   public:
    Passage(std::shared_ptr<State> state, KeyRange keys);
    Passage(const Passage&) = delete;
    Passage& operator=(const Passage&) = delete;
    ~Passage();

   private:
    const std::shared_ptr<State> state_;
    const std::vector<std::string> keys_;
  };

  std::shared_ptr<Passage> enter(KeyRange keys) const { return std::make_shared<Passage>(state_, keys); }

  bool containsAny(KeyRange keys) const {
    const std::lock_guard<std::mutex> lock(state_->mutex);
    if (state_->operationsOnAll > 0) return true;
    if (state_->counts.empty()) return false;
    for (const std::string& key : keys) {
      if (state_->counts.count(key) > 0) return true;
    }
    return false;
  }

  bool isEmpty() const {
    const std::lock_guard<std::mutex> lock(state_->mutex);
    return state_->operations == 0;
  }

 private:
  struct State {
    std::mutex mutex;  // guards the rest
    std::unordered_map<std::string, std::size_t> counts{};
    std::size_t operations = 0;
    std::size_t operationsOnAll = 0;
  };

  const std::shared_ptr<State> state_ = std::make_shared<State>();
};

inline KeysAhead::Passage::Passage(std::shared_ptr<State> state, KeyRange keys)
    : state_(std::move(state)), keys_(keys.begin(), keys.end()) {
  const std::lock_guard<std::mutex> lock(state_->mutex);
  ++state_->operations;
  if (keys_.empty()) ++state_->operationsOnAll;
  for (const std::string& key : keys_) ++state_->counts[key];
}

inline KeysAhead::Passage::~Passage() {
  const std::lock_guard<std::mutex> lock(state_->mutex);
  --state_->operations;
  if (keys_.empty()) --state_->operationsOnAll;
  for (const std::string& key : keys_) {
    const auto count = state_->counts.find(key);
    if (--count->second == 0) state_->counts.erase(count);
  }
}

}  // namespace velmora::mobile::xplat::cellar
