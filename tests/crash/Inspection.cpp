#include "crash/Inspection.h"

#include <glog/logging.h>
#include <sqlite3.h>

#include <algorithm>
#include <chrono>
#include <exception>
#include <filesystem>
#include <map>
#include <memory>
#include <optional>
#include <set>
#include <system_error>
#include <thread>
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
  for (const char* area : {"caches", "documents"}) {
    if (!fs::exists(fs::path(root) / area)) continue;
    for (const auto& entry : fs::recursive_directory_iterator(fs::path(root) / area)) {
      if (entry.path().filename() != kManifest) continue;
      facts[entry.path().parent_path().string()] = factsOf(entry.path(), fs::path(root) / "copy.sqlite");
    }
  }
  return facts;
}

// A value in short: its length, and whose and which version it says that it is.
std::string sayingOf(const Ledger::Bytes& value) {
  const auto end = std::find(value.begin(), value.end(), ';');
  return std::to_string(value.size()) + " bytes, \"" + std::string(value.begin(), end) + "\"";
}

class Inspector {
 public:
  Inspector(const std::string& root, Ending ending, Ledger& ledger, Findings& findings)
      : facts_(factsOfAll(root)),
        ending_(ending),
        ledger_(ledger),
        findings_(findings),
        orphansBefore_(std::exchange(findings.orphans, {})),
        host_(configuration(), root) {}

  void run() {
    for (const auto& [path, facts] : facts_) {
      if (facts.integrity != "ok") blame(path + " is damaged: " + facts.integrity);
    }
    for (std::size_t number = 0; number < kStores.size(); ++number) {
      stores_.push_back(host_.store<PersistentKeyValueStore>(kStores.at(number).identifier, kSession));
      checkSize(number);
    }
    if (!areStoresSafe()) {
      for (std::size_t number = 0; number < kStores.size(); ++number) checkFiles(number);
    }
    for (const Ledger::Key& key : ledger_.keys()) checkKey(key);
    for (std::size_t number = 0; number < kStores.size(); ++number) {
      checkNames(number);
      checkNewWork(number);
      if (areStoresSafe()) checkNoFileIsLeftBehind(number);
    }
    if (log_.contains("salvaged") || log_.contains("is damaged")) blame("a store was salvaged, or had a damaged value");
    if (log_.contains("purged")) blame("a store was purged");
  }

 private:
  void blame(const std::string& fault) { findings_.faults.push_back(nameOf(ending_) + (", " + fault)); }

  void checkSize(std::size_t number) {
    PersistentKeyValueStore& store = *stores_[number];
    (void)host::await(store.fetch("nothing"));  // loading comes before it
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
    const Outcome outcome = judge(key, found, isError, isMiddle);
    count(outcome, isMiddle);
    if (outcome == Outcome::Forbidden) {
      blame(std::string(kStores.at(key.first).identifier) + " " + keyName(key.second) + ": " +
            (isError ? error
             : found ? sayingOf(*found)
                     : "missing"));
    }
    const auto version = found ? ledger_.versionOf(key, *found) : std::nullopt;
    if ((found || isError) && !version) remove(key);
    ledger_.settle(key, version);
  }

  // A process that has ended by itself has left nothing half done, and a safe store never has anything.
  Outcome judge(const Ledger::Key& key, const std::optional<Ledger::Bytes>& found, bool isError, bool& isMiddle) const {
    const Outcome outcome = ledger_.judge(key, found, isError, isMiddle);
    const bool isHalf = outcome == Outcome::Partial || outcome == Outcome::Older || outcome == Outcome::Error;
    return isHalf && (ending_ != Ending::Killed || areStoresSafe()) ? Outcome::Forbidden : outcome;
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

  std::set<std::string> recordedKeys(std::size_t number) {
    const auto keys = stores_[number]->getAllKeys();
    return {keys.begin(), keys.end()};
  }

  // What files there are beside the records'. An acknowledged clear has left none.
  void checkFiles(std::size_t number) {
    const std::set<std::string> recorded = recordedKeys(number);
    std::set<std::string> cleared;
    for (const Ledger::Key& key : ledger_.keys()) {
      if (key.first == number && ledger_.isCleared(key)) cleared.insert(keyName(key.second));
    }
    for (const auto& entry : fs::directory_iterator(stores_[number]->path)) {
      const std::string name = entry.path().filename().string();
      if (name.rfind("key", 0) != 0 || recorded.count(name) > 0) continue;
      const std::string path = entry.path().string();
      findings_.orphans.insert(path);
      if (cleared.count(name) > 0 && orphansBefore_.count(path) == 0) blame(path + " has been cleared and is there");
    }
  }

  // A safe store removes what it had found at its start, and what it evicts meanwhile, before long.
  void checkNoFileIsLeftBehind(std::size_t number) {
    constexpr int kPatience = 1000;  // times 10 ms
    std::string left = fileLeftBehind(number);
    for (int i = 0; i < kPatience && !left.empty(); ++i) {
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
      left = fileLeftBehind(number);
    }
    if (!left.empty()) blame(left + " is left behind");
  }

  // Empty when there is none.
  std::string fileLeftBehind(std::size_t number) {
    std::set<std::string> named;
    for (const std::string& key : recordedKeys(number)) {
      if (const auto item = stores_[number]->getManifest()->getItem(key)) named.insert(item->filename);
    }
    for (const auto& entry : fs::directory_iterator(stores_[number]->path)) {
      const std::string name = entry.path().filename().string();
      if (name.rfind("key", 0) == 0 && named.count(name) == 0) return entry.path().string();
    }
    return "";
  }

  // No key that nobody has stored.
  void checkNames(std::size_t number) {
    std::set<std::string> known;
    for (const Ledger::Key& key : ledger_.keys()) {
      if (key.first == number) known.insert(keyName(key.second));
    }
    for (const std::string& name : recordedKeys(number)) {
      if (known.count(name) == 0) blame("nobody has stored " + name);
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
  const Ending ending_;
  Ledger& ledger_;
  Findings& findings_;
  const std::set<std::string> orphansBefore_;
  host::Host host_;
  std::vector<std::shared_ptr<PersistentKeyValueStore>> stores_;
};

}  // namespace

void inspect(const std::string& root, Ending ending, Ledger& ledger, Findings& findings) {
  try {
    Inspector(root, ending, ledger, findings).run();
  } catch (const std::exception& error) {
    findings.faults.push_back(std::string("the restart fails: ") + error.what());
  }
}

void intrude(const std::string& root, pid_t owner, Findings& findings) {
  try {
    const host::Host second(configuration(), root);
    findings.faults.emplace_back("a second host was let in while another process had the root");
  } catch (const std::exception& error) {
    const std::string text = error.what();
    const bool saysWho = text.find(root) != std::string::npos && text.find(std::to_string(owner)) != std::string::npos;
    if (!saysWho) findings.faults.push_back("a second host is not told who has the root: " + text);
    ++findings.hostsRefused;
  }
}

void endSession(const std::string& root, Ledger& ledger, Findings& findings) {
  const auto isListed = [](const host::Host& host) {
    const auto sessions = host.sessions();
    return std::any_of(sessions.begin(), sessions.end(), [](const auto& session) { return session.key == kSession; });
  };
  try {
    host::Host host(configuration(), root);
    if (!isListed(host)) findings.faults.emplace_back("a session with data is not listed");
    if (!host.logOut(kSession)) findings.faults.emplace_back("a session with data is not found by its end");
    if (isListed(host)) findings.faults.emplace_back("a session that was ended is listed");
    const auto drafts = host.store<PersistentKeyValueStore>(kStores.at(kDrafts).identifier, kSession);
    for (const Ledger::Key& key : ledger.keys()) {
      if (key.first != kDrafts) continue;
      if (host::await(drafts->fetch(keyName(key.second)))) findings.faults.emplace_back("an ended session has a value");
      ledger.settle(key, std::nullopt);
    }
    ++findings.sessionsEnded;
  } catch (const std::exception& error) {
    findings.faults.push_back(std::string("ending a session fails: ") + error.what());
  }
}

}  // namespace velmora::mobile::xplat::cellar::crash
