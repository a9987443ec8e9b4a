#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "crash/Protocol.h"

namespace velmora::mobile::xplat::cellar::crash {

// What can be found under a key after a kill. `Older`: a value of the key that had been removed or evicted, but whose
// file an earlier kill had spared; the record of a first write stands before its file does.
enum class Outcome { Old, New, Partial, Older, Error, Missing, Forbidden };
constexpr std::size_t kOutcomes = 7;

// What the workers have told, and so what may be found: of each key the last state that was acknowledged, and
// whatever was asked for after that.
class Ledger {
 public:
  using Key = std::pair<std::size_t, std::uint32_t>;  // store and number
  using Bytes = std::vector<unsigned char>;

  void note(const Record& record);

  // Judges what a fetch has answered: bytes, nothing, or an error. `isMiddle` tells whether an operation on the key was
  // under way.
  Outcome judge(const Key& key, const std::optional<Bytes>& found, bool isError, bool& isMiddle) const;

  // Whether a clear that was acknowledged has taken the key, and nobody has asked for anything with it since.
  bool isCleared(const Key& key) const;

  // From now on this is the state: what was found after the kill, or what was stored since.
  void settle(const Key& key, std::optional<std::pair<std::uint32_t, std::uint32_t>> versionAndLength);

  // Finds the version that the bytes are, for `settle`; nothing when they are no whole value.
  std::optional<std::pair<std::uint32_t, std::uint32_t>> versionOf(const Key& key, const Bytes& found) const;

  std::vector<Key> keys() const;
  std::uint32_t lastVersion() const { return lastVersion_; }

  std::size_t acknowledged = 0;
  std::size_t failed = 0;
  std::size_t dropped = 0;
  std::size_t groups = 0;
  std::size_t groupsUnderWay = 0;  // of the present worker; to be set back for the next

 private:
  struct State {
    bool isThere = false;
    std::uint32_t version = 0;
    std::uint32_t length = 0;
  };
  struct Attempt {
    State wanted;
    bool isAcknowledged = false;
    bool hasFailed = false;     // and may have taken what was there
    bool mayBeFailing = false;  // it met a shortage
  };
  struct History {
    State settled;
    std::vector<Attempt> attempts;       // in the order in which they were called
    std::optional<std::size_t> cleared;  // so many of them a clear has certainly met, and undone
  };
  using Met = std::map<Key, std::size_t>;  // how many attempts a clear meets for certain

  // The states that may be found: the last acknowledged one and then what was wanted after it.
  static std::vector<State> possible(const History& history);

  void noteGroup(const Record& record);
  void noteClear(const Record& record);
  void noteShortage(const Record& record);

  std::map<Key, History> histories_;
  std::map<std::uint32_t, Met> clears_;  // under way, by number
  std::uint32_t lastVersion_ = 0;
  bool isShort_ = false;
};

}  // namespace velmora::mobile::xplat::cellar::crash
