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
constexpr std::array<StoreInfo, 5> kStores = {{{"letters", 40, 20000, false, true},
                                               {"settings", 40, 1500, true, true},
                                               {"recent", 60, 8000, false, false},
                                               {"thumbs", 60, 8000, false, false},
                                               {"chunks", 60, 1500, true, false}}};

extern const char* const kConfiguration;

// What the worker tells through the pipe, in whole records: before it asks for an operation and when that is done.
struct Record {
  enum class Kind : std::uint8_t { Ready, Begun, Done, Failed };
  enum class Operation : std::uint8_t { Store, Remove, Fetch };

  Kind kind;
  Operation operation;
  std::uint8_t store;
  std::uint8_t unused = 0;
  std::uint32_t key;
  std::uint32_t version;  // counts up by key over all workers
  std::uint32_t length;   // of the value
};

std::string keyName(std::uint32_t key);

// The value of a version: it says whose it is, and no other version has it. Never shorter than that saying.
std::vector<unsigned char> valueOf(std::size_t store, std::uint32_t key, std::uint32_t version, std::uint32_t length);

}  // namespace velmora::mobile::xplat::cellar::crash
