#include "crash/Ledger.h"

#include <algorithm>
#include <cstdlib>

namespace velmora::mobile::xplat::cellar::crash {

namespace {

// Whether the bytes say that they are the key's own, and are.
bool isOlder(const Ledger::Key& key, const Ledger::Bytes& found) {
  const std::string text(found.begin(), found.end());
  const auto mark = text.find('#');
  if (mark == std::string::npos || text.find(';') == std::string::npos) return false;
  const auto version = static_cast<std::uint32_t>(std::strtoul(text.c_str() + mark + 1, nullptr, 10));
  return found == valueOf(key.first, key.second, version, static_cast<std::uint32_t>(found.size()));
}

}  // namespace

void Ledger::note(const Record& record) {
  if (record.kind == Record::Kind::Done) ++acknowledged;
  if (record.kind == Record::Kind::Failed) ++failed;
  if (record.kind == Record::Kind::Ready || record.operation == Record::Operation::Fetch) return;

  const State wanted{record.operation == Record::Operation::Store, record.version, record.length};
  lastVersion_ = std::max(lastVersion_, record.version);
  auto& attempts = histories_[{record.store, record.key}].attempts;
  if (record.kind == Record::Kind::Begun) return attempts.push_back({wanted, false});
  if (record.kind == Record::Kind::Failed) return;  // whatever it has left
  for (Attempt& attempt : attempts) {
    const bool isIt =
        !attempt.isAcknowledged && attempt.wanted.isThere == wanted.isThere && attempt.wanted.version == wanted.version;
    if (!isIt) continue;
    attempt.isAcknowledged = true;
    return;
  }
}

std::vector<Ledger::State> Ledger::possible(const History& history) {
  std::vector<State> states = {history.settled};
  for (const Attempt& attempt : history.attempts) {
    // Operations on a key take effect in order: this one has, and so have those before it.
    if (attempt.isAcknowledged) states.clear();
    states.push_back(attempt.wanted);
  }
  return states;
}

Outcome Ledger::judge(const Key& key, const std::optional<Bytes>& found, bool isError, bool& isMiddle) const {
  const auto history = histories_.find(key);
  const std::vector<State> states = history == histories_.end() ? std::vector<State>{{}} : possible(history->second);
  isMiddle = states.size() > 1;
  const bool keepsAll = kStores.at(key.first).keepsAll;
  if (isError) return isMiddle ? Outcome::Error : Outcome::Forbidden;
  if (!found) {
    const auto isAbsent = [](const State& state) { return !state.isThere; };
    const bool mayBe = !keepsAll || std::any_of(states.begin(), states.end(), isAbsent);
    return mayBe ? Outcome::Missing : Outcome::Forbidden;
  }
  for (std::size_t i = states.size(); i-- > 0;) {
    const State& state = states[i];
    if (!state.isThere) continue;
    const Bytes whole = valueOf(key.first, key.second, state.version, state.length);
    if (*found == whole) return i == 0 ? Outcome::Old : Outcome::New;
    // A first state that is acknowledged and complete cannot be cut short, unless something after it began to write.
    const bool isPrefix = found->size() <= whole.size() && std::equal(found->begin(), found->end(), whole.begin());
    if (isPrefix && isMiddle && i > 0) return Outcome::Partial;
  }
  const bool isBeingWritten =
      std::any_of(states.begin() + 1, states.end(), [](const State& state) { return state.isThere; });
  return isBeingWritten && isOlder(key, *found) ? Outcome::Older : Outcome::Forbidden;
}

std::optional<std::pair<std::uint32_t, std::uint32_t>> Ledger::versionOf(const Key& key, const Bytes& found) const {
  const auto history = histories_.find(key);
  if (history == histories_.end()) return std::nullopt;
  for (const State& state : possible(history->second)) {
    if (state.isThere && found == valueOf(key.first, key.second, state.version, state.length)) {
      return std::pair(state.version, state.length);
    }
  }
  return std::nullopt;
}

void Ledger::settle(const Key& key, std::optional<std::pair<std::uint32_t, std::uint32_t>> versionAndLength) {
  History& history = histories_[key];
  history.attempts.clear();
  history.settled = {};
  if (!versionAndLength) return;
  history.settled = {true, versionAndLength->first, versionAndLength->second};
  lastVersion_ = std::max(lastVersion_, versionAndLength->first);
}

std::vector<Ledger::Key> Ledger::keys() const {
  std::vector<Key> keys;
  keys.reserve(histories_.size());
  for (const auto& history : histories_) keys.push_back(history.first);
  return keys;
}

}  // namespace velmora::mobile::xplat::cellar::crash
