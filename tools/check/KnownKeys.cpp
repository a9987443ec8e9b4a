#include "check/KnownKeys.h"

#include <algorithm>
#include <cctype>
#include <cstddef>
#include <map>

namespace velmora::mobile::xplat::cellar::tools {

namespace {

using Keys = std::vector<std::string>;

// Ignores differences in case and in how words are joined: "maxSize" is "max_size".
std::string withoutStyle(const std::string& key) {
  std::string plain;
  for (const char character : key) {
    if (character == '_' || character == '-' || character == ' ') continue;
    plain += static_cast<char>(std::tolower(static_cast<unsigned char>(character)));
  }
  return plain;
}

std::size_t distance(const std::string& a, const std::string& b) {
  std::vector<std::vector<std::size_t>> costs(a.size() + 1, std::vector<std::size_t>(b.size() + 1));
  for (std::size_t i = 0; i <= a.size(); ++i) {
    for (std::size_t j = 0; j <= b.size(); ++j) {
      if (i == 0 || j == 0) {
        costs[i][j] = i + j;
        continue;
      }
      const std::size_t change = costs[i - 1][j - 1] + (a[i - 1] == b[j - 1] ? 0 : 1);
      costs[i][j] = std::min({change, costs[i - 1][j] + 1, costs[i][j - 1] + 1});
      const bool swapped = i > 1 && j > 1 && a[i - 1] == b[j - 2] && a[i - 2] == b[j - 1];
      if (swapped) costs[i][j] = std::min(costs[i][j], costs[i - 2][j - 2] + 1);
    }
  }
  return costs[a.size()][b.size()];
}

}  // namespace

const Keys& keysOfManagers() {
  static const Keys keys = {"area", "max_size", "prune_interval", "session_scoped", "stores"};
  return keys;
}

const Keys& keysOfStores(const std::string& type) {
  static const Keys common = {"name", "type", "locale_sensitive", "has_version", "version"};
  static const auto with = [](Keys own) {
    own.insert(own.begin(), common.begin(), common.end());
    return own;
  };
  static const std::map<std::string, Keys> keys = {
      {"unmanaged", with({"is_cache", "max_size"})},
      {"pkvs", with({"inline_data", "stale_age", "capacity", "durability"})},
      {"disk_cache", with({"inline_data", "stale_age", "lru_size_limit", "survival_size", "metadata_factory",
                           "prune_strategy", "capacity", "durability"})}};
  return keys.at(type);
}

const Keys& storeTypes() {
  static const Keys types = {"unmanaged", "pkvs", "disk_cache"};
  return types;
}

std::string nearestKey(const std::string& key, const Keys& known) {
  constexpr std::size_t longest = 64;  // longer ones resemble no known key, and comparing takes time
  if (key.size() > longest) return "";
  const std::string plain = withoutStyle(key);
  std::string nearest;
  std::size_t best = std::max<std::size_t>(2, plain.size() / 3) + 1;
  for (const std::string& candidate : known) {
    const std::size_t away = distance(plain, withoutStyle(candidate));
    if (away >= best) continue;
    best = away;
    nearest = candidate;
  }
  return nearest;
}

}  // namespace velmora::mobile::xplat::cellar::tools
