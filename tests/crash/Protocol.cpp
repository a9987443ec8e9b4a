#include "crash/Protocol.h"

#include <algorithm>
#include <cstdlib>

namespace velmora::mobile::xplat::cellar::crash {

namespace {

const char* const kSafe = "CELLAR_CRASH_SAFE";

// The caches hold far less than what is stored in them, and one store far fewer items than it has keys.
const char* const kConfiguration = R"({
  "media": {
    "max_size": "50KB",
    "prune_interval": "1 minutes",
    "session_scoped": false,
    "stores": {
      "letters": {"type": "pkvs", "stale_age": "10 years"},
      "settings": {"type": "pkvs", "inline_data": true, "stale_age": "10 years"},
      "recent": {"type": "pkvs", "capacity": 20, "stale_age": "10 years"},
      "thumbs": {"type": "disk_cache", "lru_size_limit": "60KB", "survival_size": "10KB", "stale_age": "10 years"},
      "chunks": {"type": "disk_cache", "lru_size_limit": "10KB", "inline_data": true, "stale_age": "10 years",
                 "metadata_factory": "video_download", "prune_strategy": "video_download"},
      "pictures": {"type": "disk_cache", "lru_size_limit": "40KB", "survival_size": "10KB", "stale_age": "10 years",
                   "prune_strategy": "greedy_dual"}
    }
  },
  "inbox": {
    "area": "documents",
    "stores": {"drafts": {"type": "pkvs", "stale_age": "10 years"}}
  }
})";

}  // namespace

void chooseSafeStores() {
  (void)::setenv(kSafe, "1", 1);  // NOLINT(concurrency-mt-unsafe): there is no other thread yet
}

bool areStoresSafe() {
  static const bool areSafe = std::getenv(kSafe) != nullptr;  // NOLINT(concurrency-mt-unsafe)
  return areSafe;
}

std::string configuration() {
  std::string text = kConfiguration;
  if (!areStoresSafe()) return text;
  const std::string before = "\"stale_age\"";
  const std::string durability = "\"durability\": \"safe\", ";
  for (auto at = text.find(before); at != std::string::npos; at = text.find(before, at + durability.size() + 1)) {
    text.insert(at, durability);
  }
  return text;
}

const char* nameOf(Ending ending) {
  static constexpr std::array<const char*, 6> names = {"killed",         "closed at rest",   "closed while busy",
                                                       "closed at once", "queues shut down", "let go"};
  return names.at(static_cast<std::size_t>(ending));
}

std::string keyName(std::uint32_t key) { return "key" + std::to_string(key); }

std::vector<unsigned char> valueOf(std::size_t store, std::uint32_t key, std::uint32_t version, std::uint32_t length) {
  const std::string saying =
      std::string(kStores.at(store).identifier) + "/" + keyName(key) + "#" + std::to_string(version) + ";";
  std::vector<unsigned char> value(saying.begin(), saying.end());
  value.resize(std::max<std::size_t>(value.size(), length));
  std::uint32_t state = static_cast<std::uint32_t>(store) * 2654435761U + key * 40503U + version * 97U + 1U;
  for (std::size_t i = saying.size(); i < value.size(); ++i) {
    state = state * 1664525U + 1013904223U;
    value[i] = static_cast<unsigned char>(state >> 24U);
  }
  return value;
}

}  // namespace velmora::mobile::xplat::cellar::crash
