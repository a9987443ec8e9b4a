#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::crash {

// The stores that the worker is at work on, by their number in records.
struct StoreInfo {
  const char* identifier;
  std::uint32_t keys;      // how many different ones
  std::uint32_t maxBytes;  // of a usual value
  bool isInline;
  bool keepsAll;  // nothing but a removal takes a value away
};
constexpr std::array<StoreInfo, 7> kStores = {{{"letters", 40, 20000, false, true},
                                               {"settings", 40, 1500, true, true},
                                               {"recent", 60, 8000, false, false},
                                               {"thumbs", 60, 8000, false, false},
                                               {"chunks", 60, 1500, true, false},
                                               {"drafts", 30, 5000, false, true},
                                               {"pictures", 60, 8000, false, false}}};
constexpr std::size_t kRecent = 2;  // is cleared now and then
constexpr std::size_t kDrafts = 5;  // of the session
constexpr const char* kSession = "alice";

// Whether the stores are safe ones: chosen by the first process, found in the environment by the others.
void chooseSafeStores();
bool areStoresSafe();

std::string configuration();

// How the worker is to end.
enum class Ending : std::uint8_t {
  Killed,
  AtRest,     // nobody asks for anything any more: the host finishes what is queued
  Busy,       // the host is destroyed while threads go on asking
  Impatient,  // the same, without waiting for what is under way
  ShutDown,   // the application's own queues are shut down, then the host is destroyed, while threads go on asking
  LetGo,      // the host and all stores are released, and the application's own queues finish what is queued
};

// Whether each operation that was asked for is carried out.
constexpr bool finishesAll(Ending ending) { return ending == Ending::AtRest || ending == Ending::LetGo; }

// What the worker tells through the pipe, in whole records: before it asks for an operation and when that is done.
// `Dropped`: its promise was broken, so that it has not begun. A clear has no key, and its number for a version. During
// a shortage nothing can be opened, so that operations fail. A group is several operations in one transaction, from the
// beginning of that to its end.
struct Record {
  enum class Kind : std::uint8_t { Ready, Begun, Done, Failed, Dropped };
  enum class Operation : std::uint8_t { Store, Remove, Fetch, Clear, Shortage, Group };

  Kind kind;
  Operation operation;
  std::uint8_t store;
  std::uint8_t unused = 0;
  std::uint32_t key;
  std::uint32_t version;  // counts up by key over all workers
  std::uint32_t length;   // of the value
};

const char* nameOf(Ending ending);

std::string keyName(std::uint32_t key);

// The value of a version: it says whose it is, and no other version has it. Never shorter than that saying.
std::vector<unsigned char> valueOf(std::size_t store, std::uint32_t key, std::uint32_t version, std::uint32_t length);

}  // namespace velmora::mobile::xplat::cellar::crash
