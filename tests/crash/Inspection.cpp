#include "crash/Inspection.h"

#include <glog/logging.h>
#include <sqlite3.h>

#include <algorithm>
#include <exception>
#include <filesystem>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <system_error>
#include <utility>

#include "DiskCacheManifest.h"
#include "PersistentKeyValueStore.h"
#include "host/Await.h"
#include "host/Host.h"
#include "support/LogCapture.h"

namespace velmora::mobile::xplat::cellar::crash {

namespace {

namespace fs = std::filesystem;

constexpr const char* kManifest = "manifest_v1.sqlite";

struct ManifestFacts {
  std::string integrity = "ok";
  std::string size = "0";
};

std::string oneAnswer(sqlite3* database, const char* question) {
  std::string answer;
  const auto take = [](void* target, int, char** values, char**) {
    *static_cast<std::string*>(target) = values[0] == nullptr ? "0" : values[0];
    return 0;
  };
  if (sqlite3_exec(database, question, take, &answer, nullptr) != SQLITE_OK) answer = sqlite3_errmsg(database);
  return answer;
}

// Asks a copy, so that the library is the first to open the real one after the kill.
ManifestFacts factsOf(const fs::path& manifest, const fs::path& place) {
  ManifestFacts facts;
  if (!fs::exists(manifest)) return facts;
  for (const char* companion : {"", "-wal"}) {
    std::error_code ignored;
    fs::remove(place.string() + companion, ignored);
    fs::copy_file(manifest.string() + companion, place.string() + companion, ignored);
  }
  fs::remove(place.string() + "-shm");
  sqlite3* database = nullptr;
  if (sqlite3_open(place.c_str(), &database) == SQLITE_OK) {
    facts.integrity = oneAnswer(database, "PRAGMA integrity_check");
    // Killed before there was a table, it holds nothing yet.
    const std::string tables = oneAnswer(database, "SELECT COUNT(*) FROM sqlite_master WHERE name = 'LarderManifest'");
    if (tables == "1") facts.size = oneAnswer(database, "SELECT SUM(size) FROM LarderManifest");
  } else {
    facts.integrity = sqlite3_errmsg(database);
  }
  sqlite3_close(database);
  return facts;
}

std::map<std::string, ManifestFacts> factsOfAll(const std::string& root) {
  std::map<std::string, ManifestFacts> facts;
  const fs::path area = fs::path(root) / "caches";
  if (!fs::exists(area)) return facts;
  for (const auto& entry : fs::recursive_directory_iterator(area)) {
    if (entry.path().filename() != kManifest) continue;
    facts[entry.path().parent_path().string()] = factsOf(entry.path(), fs::path(root) / "copy.sqlite");
  }
  return facts;
}

class Inspector {
 public:
  Inspector(const std::string& root, Ledger& ledger, Findings& findings)
      : facts_(factsOfAll(root)), ledger_(ledger), findings_(findings), host_(kConfiguration, root) {}

  void run() {
    for (const auto& [path, facts] : facts_) {
      if (facts.integrity != "ok") blame(path + " is damaged: " + facts.integrity);
    }
    for (std::size_t number = 0; number < kStores.size(); ++number) {
      stores_.push_back(host_.store<PersistentKeyValueStore>(kStores.at(number).identifier));
      checkSize(number);
    }
    for (const Ledger::Key& key : ledger_.keys()) checkKey(key);
    for (std::size_t number = 0; number < kStores.size(); ++number) {
      checkNames(number);
      checkNewWork(number);
    }
    if (log_.contains("purged")) blame("a store was purged");
  }

 private:
  void blame(const std::string& fault) { findings_.faults.push_back(fault); }

  void checkSize(std::size_t number) {
    PersistentKeyValueStore& store = *stores_[number];
    host::await(store.fetch("nothing"));  // loading comes before it
    const auto facts = facts_.find(store.path);
    const std::string wanted = facts == facts_.end() ? "0" : facts->second.size;
    const std::string size = std::to_string(store.getManifest()->size());
    if (size != wanted) blame(store.path + " has size " + size + ", its manifest " + wanted);
  }

  void checkKey(const Ledger::Key& key) {
    PersistentKeyValueStore& store = *stores_[key.first];
    std::optional<Ledger::Bytes> found;
    bool isError = false;
    std::string error;
    try {
      if (auto result = host::await(store.fetch(keyName(key.second)))) found = std::move(result->value);
    } catch (const std::exception& exception) {
      isError = true;
      error = exception.what();
    }
    bool isMiddle = false;
    const Outcome outcome = ledger_.judge(key, found, isError, isMiddle);
    count(outcome, isMiddle);
    if (outcome == Outcome::Forbidden) {
      const std::string what = isError ? error : found ? std::to_string(found->size()) + " bytes" : "missing";
      blame(std::string(kStores.at(key.first).identifier) + " " + keyName(key.second) + ": " + what +
            (found
                 ? " beginning with " +
                       std::string(found->begin(), found->begin() + std::min<std::ptrdiff_t>(
                                                                        40, static_cast<std::ptrdiff_t>(found->size())))
                 : ""));
    }
    const auto version = found ? ledger_.versionOf(key, *found) : std::nullopt;
    if ((found || isError) && !version) remove(key);
    ledger_.settle(key, version);
  }

  void count(Outcome outcome, bool isMiddle) {
    if (isMiddle) {
      ++findings_.middle.at(static_cast<std::size_t>(outcome));
    } else if (outcome == Outcome::Missing) {
      ++findings_.evicted;
    } else {
      ++findings_.intact;
    }
  }

  // What was found torn. A record without its file goes, though its removal says that there was none.
  void remove(const Ledger::Key& key) {
    const std::string name = keyName(key.second);
    try {
      host::await(stores_[key.first]->removeItem(name));
    } catch (const std::exception&) {
    }
    if (host::await(stores_[key.first]->fetch(name)) != nullptr) blame(name + " cannot be removed");
  }

  // No key that nobody has stored, and what files there are beside the records'.
  void checkNames(std::size_t number) {
    std::set<std::string> known;
    for (const Ledger::Key& key : ledger_.keys()) {
      if (key.first == number) known.insert(keyName(key.second));
    }
    std::set<std::string> recorded;
    for (const std::string& name : stores_[number]->getAllKeys()) {
      recorded.insert(name);
      if (known.count(name) == 0) blame("nobody has stored " + name);
    }
    for (const auto& entry : fs::directory_iterator(stores_[number]->path)) {
      const std::string name = entry.path().filename().string();
      if (name.rfind("key", 0) == 0 && recorded.count(name) == 0) ++findings_.orphans;
    }
  }

  void checkNewWork(std::size_t number) {
    const std::uint32_t key = kStores.at(number).keys;  // one that no worker has
    const std::uint32_t version = ledger_.lastVersion() + 1;
    const auto value = valueOf(number, key, version, 100);
    host::await(stores_[number]->store(keyName(key), value));
    const auto found = host::await(stores_[number]->fetch(keyName(key)));
    const bool mayBeMissing = !kStores.at(number).keepsAll;  // evicted already
    if (found == nullptr ? !mayBeMissing : found->value != value) blame("new work fails");
    ledger_.settle({number, key}, std::pair(version, 100U));
  }

  const test::LogCapture log_;
  const std::map<std::string, ManifestFacts> facts_;
  Ledger& ledger_;
  Findings& findings_;
  host::Host host_;
  std::vector<std::shared_ptr<PersistentKeyValueStore>> stores_;
};

}  // namespace

void inspect(const std::string& root, Ledger& ledger, Findings& findings) {
  try {
    Inspector(root, ledger, findings).run();
  } catch (const std::exception& error) {
    findings.faults.push_back(std::string("the restart fails: ") + error.what());
  }
}

}  // namespace velmora::mobile::xplat::cellar::crash
