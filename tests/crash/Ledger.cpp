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
  if (record.operation == Record::Operation::Group) return noteGroup(record);
  if (record.kind == Record::Kind::Done) ++acknowledged;
  if (record.kind == Record::Kind::Failed) ++failed;
  if (record.kind == Record::Kind::Dropped) ++dropped;
  if (record.kind == Record::Kind::Ready) isShort_ = false;
  if (record.kind == Record::Kind::Ready || record.operation == Record::Operation::Fetch) return;

  if (record.operation == Record::Operation::Shortage) return noteShortage(record);
  lastVersion_ = std::max(lastVersion_, record.version);
  if (record.operation == Record::Operation::Clear) return noteClear(record);
  const State wanted{record.operation == Record::Operation::Store, record.version, record.length};
  auto& attempts = histories_[{record.store, record.key}].attempts;
  if (record.kind == Record::Kind::Begun) return attempts.push_back({wanted, false, false, isShort_});
  if (record.kind == Record::Kind::Dropped) return;
  for (Attempt& attempt : attempts) {
    const bool isIt = !attempt.isAcknowledged && !attempt.hasFailed && attempt.wanted.isThere == wanted.isThere &&
                      attempt.wanted.version == wanted.version;
    if (!isIt) continue;
    (record.kind == Record::Kind::Done ? attempt.isAcknowledged : attempt.hasFailed) = true;
    return;
  }
}

void Ledger::noteGroup(const Record& record) {
  if (record.kind == Record::Kind::Begun) {
    ++groups;
    ++groupsUnderWay;
  } else {
    --groupsUnderWay;
  }
}

// What was acknowledged before a clear was asked for is gone when that is done. What was under way may be or not.
void Ledger::noteClear(const Record& record) {
  if (record.kind == Record::Kind::Begun) {
    Met& met = clears_[record.version];
    for (const auto& [key, history] : histories_) {
      if (key.first != record.store) continue;
      const auto& attempts = history.attempts;
      const auto last = std::find_if(attempts.rbegin(), attempts.rend(),
                                     [](const Attempt& attempt) { return attempt.isAcknowledged; });
      met[key] = static_cast<std::size_t>(attempts.rend() - last);
    }
  } else if (record.kind == Record::Kind::Done) {
    for (const auto& [key, count] : clears_[record.version]) {
      auto& cleared = histories_[key].cleared;
      cleared = std::max(cleared.value_or(0), count);
    }
  }
}

// What fails takes the value along before it says so.
void Ledger::noteShortage(const Record& record) {
  isShort_ = record.kind == Record::Kind::Begun;
  for (auto& [key, history] : histories_) {
    for (Attempt& attempt : history.attempts) attempt.mayBeFailing = attempt.mayBeFailing || isShort_;
  }
}

bool Ledger::isCleared(const Key& key) const {
  const auto history = histories_.find(key);
  return history != histories_.end() && history->second.cleared == history->second.attempts.size();
}

std::vector<Ledger::State> Ledger::possible(const History& history) {
  std::vector<State> states = {history.settled};
  for (std::size_t i = 0; i <= history.attempts.size(); ++i) {
    if (history.cleared == i) states = {State{}};
    if (i == history.attempts.size()) break;
    const Attempt& attempt = history.attempts[i];
    // Operations on a key take effect in order: this one has, and so have those before it.
    if (attempt.isAcknowledged) states.clear();
    states.push_back(attempt.wanted);
    if (attempt.hasFailed || (attempt.mayBeFailing && !attempt.isAcknowledged)) states.push_back({});
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
  history = {};
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
