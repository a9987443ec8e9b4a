#include "faults/ScriptedWorkload.h"

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <unistd.h>

#include <algorithm>
#include <exception>
#include <filesystem>
#include <fstream>
#include <utility>

#include "AttributeStore.h"
#include "Configuration.h"
#include "DiskSizeCalculator.h"
#include "LazyDispatcher.h"
#include "PathLocations.h"
#include "Store.h"
#include "StoreManager.h"
#include "StoreManagerFactory.h"
#include "host/testing/RecordingAnalytics.h"

namespace velmora::mobile::xplat::cellar::test {

namespace {

const char* const kConfiguration = R"({
  "media": {
    "max_size": "200B",
    "prune_interval": "1 minutes",
    "session_scoped": false,
    "stores": {
      "letters": {"type": "pkvs", "stale_age": "100 years"},
      "settings": {"type": "pkvs", "inline_data": true, "stale_age": "100 years"},
      "recent": {"type": "pkvs", "capacity": 3, "stale_age": "1 hours"},
      "thumbs": {"type": "disk_cache", "lru_size_limit": "100B", "survival_size": "50B", "stale_age": "100 years"},
      "web": {"type": "unmanaged", "is_cache": true, "max_size": "1KB"}
    }
  },
  "inbox": {
    "area": "documents",
    "stores": {"notes": {"type": "pkvs", "stale_age": "100 years"}}
  }
})";

// The cache of stores that are not relaxed evicts in the order that has most to put back after a failure.
std::string configurationOf(Durability durability) {
  std::string text = kConfiguration;
  if (durability == Durability::Relaxed) return text;
  const std::string limit = "\"lru_size_limit\"";
  text.insert(text.find(limit), "\"prune_strategy\": \"greedy_dual\", ");
  const std::string before = "\"stale_age\"";
  const std::string key =
      durability == Durability::Safe ? "\"durability\": \"safe\", " : "\"durability\": \"synced\", ";
  for (auto at = text.find(before); at != std::string::npos; at = text.find(before, at + key.size() + 1)) {
    text.insert(at, key);
  }
  return text;
}

const std::vector<std::string> kStores = {"letters", "settings", "recent", "thumbs", "notes"};

// How the line begins that tells of a purge.
std::string lineOf(const std::string& store) { return "Store \"" + store + "\""; }

std::string valueOf(const std::string& key, int version) {
  std::string value = key + " " + std::to_string(version) + " ";
  value.resize(30, static_cast<char>('a' + version % 26));
  return value;
}

struct Locations final : PathLocations {
  std::string root;
  explicit Locations(std::string root_) : root(std::move(root_)) {}
  std::string pathForArea(Area area, const std::string& /*sessionKey*/) override {
    return root + (area == Area::Documents ? "/documents" : "/caches");
  }
};

bool isPrefixOfOne(const std::string& text, const std::set<std::string>& values) {
  return std::any_of(values.begin(), values.end(), [&](const std::string& v) { return v.rfind(text, 0) == 0; });
}

std::string oneAnswer(sqlite3* database, const char* question) {
  std::string answer = "nothing";
  const auto take = [](void* target, int, char** values, char**) {
    *static_cast<std::string*>(target) = values[0] == nullptr ? "null" : values[0];
    return 0;
  };
  if (sqlite3_exec(database, question, take, &answer, nullptr) != SQLITE_OK) answer = sqlite3_errmsg(database);
  return answer;
}

}  // namespace

// One run of the application.
struct ScriptedWorkload::Process {
  std::shared_ptr<ManualQueueFactory> queues = std::make_shared<ManualQueueFactory>();
  std::shared_ptr<ManualQueueFactory> trashQueues = std::make_shared<ManualQueueFactory>();
  std::shared_ptr<EventLog> events = std::make_shared<EventLog>();
  std::shared_ptr<RecordingTrashCollector> trash;
  std::shared_ptr<DiskSizeCalculator> sizes;
  std::shared_ptr<LazyDispatcher> lazyWork;
  std::unique_ptr<StoreManagerFactory> sessionless;
  std::unique_ptr<StoreManagerFactory> sessionScoped;
  std::map<std::string, std::shared_ptr<StoreManager>> managers;
  std::map<std::string, std::shared_ptr<PersistentKeyValueStore>> stores;
  std::map<std::string, std::string> paths;  // of all stores that were ever opened
  std::shared_ptr<UnmanagedStore> web;

  Process(const std::string& root, const std::shared_ptr<FileUtils>& files, Durability durability) {
    const auto reporter = recordingReporter(events);
    trash = std::make_shared<RecordingTrashCollector>(root + "/trash", files, reporter, trashQueues);
    const auto attributes = std::make_shared<AttributeStore>(files);
    sizes = std::make_shared<DiskSizeCalculator>(files, attributes, reporter);
    lazyWork = LazyDispatcher::createLazyDispatcher(queues, 10);
    const auto configuration = std::make_shared<const Configuration>(configurationOf(durability));
    const auto locations = std::make_shared<Locations>(root);
    const auto names = std::make_shared<StoreDirectoryNameBuilderFactory>("250", "US", "en");
    const auto factory = [&](bool servesSessionScoped) {
      return std::make_unique<StoreManagerFactory>(servesSessionScoped, reporter, attributes, configuration, sizes,
                                                   files, lazyWork, locations, names, queues, trash,
                                                   [](const std::string& sessionKey) { return sessionKey; });
    };
    sessionless = factory(false);
    sessionScoped = factory(true);
  }

  std::vector<std::shared_ptr<ManualExecutor>> executors() const {
    auto all = queues->all();
    for (const auto& executor : trashQueues->all()) all.push_back(executor);
    return all;
  }

  // What waits on the queues never runs, nor what is asked of them for that reason.
  void dropAll() const {
    const auto waits = [](const std::shared_ptr<ManualExecutor>& queue) { return queue->pending() > 0; };
    for (auto all = executors(); std::any_of(all.begin(), all.end(), waits); all = executors()) {
      for (const auto& queue : all) queue->dropAll();
    }
  }

  // What the application holds; the queues stay.
  void letGo() {
    lazyWork->willBeTriggeredExternally();
    web.reset();
    stores.clear();
    managers.clear();
    sessionScoped.reset();
    sessionless.reset();
  }

  // Whoever waits for a queue on this thread finds it running.
  void runQueuesAtOnce(bool atOnce) const {
    for (const auto& queue : executors()) {
      queue->onDispatch = atOnce ? [raw = queue.get()] { raw->runAll(); } : std::function<void()>();
    }
  }
};

// A write that has been asked for.
struct ScriptedWorkload::Asked {
  std::string store;
  std::string key;
  std::string value;
  Written written;
  std::size_t purgesBefore;
  std::size_t faultsBefore;
};

struct ScriptedWorkload::Step {
  const char* name;
  void (ScriptedWorkload::*run)();
};

const std::vector<ScriptedWorkload::Step>& ScriptedWorkload::script() {
  static const std::vector<Step> steps = {
      {"start", &ScriptedWorkload::start},
      {"fill", &ScriptedWorkload::fill},
      {"fetch", &ScriptedWorkload::fetchSome},
      {"overwrite", &ScriptedWorkload::overwrite},
      {"remove", &ScriptedWorkload::remove},
      {"evict", &ScriptedWorkload::evict},
      {"prune", &ScriptedWorkload::prune},
      {"measure", &ScriptedWorkload::measure},
      {"expire", &ScriptedWorkload::expire},
      {"clear", &ScriptedWorkload::clear},
      {"flush", &ScriptedWorkload::flush},
      {"empty the trash", &ScriptedWorkload::emptyTrash},
      {"survive", &ScriptedWorkload::survive},
      {"mark for the trash", &ScriptedWorkload::markForTrash},
      {"invalidate", &ScriptedWorkload::invalidate},
      {"restart", &ScriptedWorkload::restart},
      {"fetch all", &ScriptedWorkload::fetchAll},
      {"fill again", &ScriptedWorkload::fillAgain},
      {"change at once", &ScriptedWorkload::changeAtOnce},
      {"close in the middle", &ScriptedWorkload::closeInTheMiddle},
      {"let go in the middle", &ScriptedWorkload::letGoInTheMiddle},
  };
  return steps;
}

std::size_t ScriptedWorkload::stepCount() { return script().size(); }

ScriptedWorkload::ScriptedWorkload(const std::string& root, FaultMode mode, Durability durability)
    : root_(root), mode_(mode), durability_(durability), isSafe_(durability != Durability::Relaxed) {}

ScriptedWorkload::~ScriptedWorkload() { end(); }

void ScriptedWorkload::step(std::size_t number) {
  const Step& step = script().at(number);
  const testing::ScopedTrace trace(__FILE__, __LINE__, step.name);
  (this->*step.run)();
  notePurges();
  if (mode_ != FaultMode::ManyFaults) expectEachPurgeIsReported();
}

void ScriptedWorkload::end() {
  if (process_ == nullptr) return;
  process_->letGo();
  settle();
  process_.reset();
}

std::string quickPlace() {
  const char* const memory = "/dev/shm";
  return ::access(memory, W_OK | X_OK) == 0 ? memory : testing::TempDir();
}

// --- The script ---

void ScriptedWorkload::start() {
  process_ = std::make_unique<Process>(root_, files, durability_);
  purges_.clear();
  for (const std::string& name : kStores) linesBeforeStart_[name] = purgeLines(lineOf(name));
  mayThrow_ = true;
  for (const auto& [manager, isSessionScoped] : {std::pair("media", false), std::pair("inbox", true)}) {
    attempt([&, name = manager, scoped = isSessionScoped] {
      StoreManagerFactory& factory = scoped ? *process_->sessionScoped : *process_->sessionless;
      process_->managers[name] = factory.managerForIdentifier(name, scoped ? "alice" : "", true);
    });
    settle();
  }
  for (const std::string& name : kStores) {
    const auto manager = process_->managers.find(name == "notes" ? "inbox" : "media");
    if (manager == process_->managers.end() || manager->second == nullptr) continue;
    attempt([&] {
      const auto opened = manager->second->getStore<PersistentKeyValueStore>(name);
      if (opened == nullptr) return;
      process_->stores[name] = opened;
      process_->paths[name] = opened->path;
    });
    settle();
  }
  if (const auto media = process_->managers.find("media"); media != process_->managers.end()) {
    attempt([&] { process_->web = media->second->getStore<UnmanagedStore>("web"); });
    settle();
  }
  mayThrow_ = false;
}

void ScriptedWorkload::restart() {
  end();
  start();
}

void ScriptedWorkload::fill() {
  for (const char* key : {"a", "b", "c"}) {
    put("letters", key, 1);
    put("settings", key, 1);
    put("recent", key, 1);
    put("thumbs", key, 1);
  }
  put("notes", "a", 1);
}

void ScriptedWorkload::fetchSome() {
  fetch("letters", "a");
  fetch("letters", "unknown");
  fetch("settings", "a");
  fetch("thumbs", "a");
}

void ScriptedWorkload::overwrite() {
  put("letters", "b", 2);
  put("settings", "b", 2);
  put("thumbs", "b", 2);
}

void ScriptedWorkload::remove() {
  drop("letters", "c");
  drop("settings", "c");
  drop("letters", "unknown");
}

void ScriptedWorkload::evict() {
  mayGo("recent");
  put("recent", "d", 1);
}

void ScriptedWorkload::prune() {
  for (const char* key : {"d", "e"}) {
    mayGo("thumbs");
    put("thumbs", key, 1);
  }
  if (!has("thumbs")) return;
  attempt([&] { store("thumbs").pruneBackToNormal(nullptr, nullptr, false); });
  settle();
}

void ScriptedWorkload::measure() {
  if (process_->web == nullptr) return;
  std::ofstream(process_->web->path + "/page") << std::string(2000, 'x');
  attempt([&] { process_->sizes->calculateDirectorySize(process_->web->path); });
}

void ScriptedWorkload::expire() {
  clock_.advance(7200);
  const std::size_t before = faults();
  mayGo("recent");
  put("recent", "late", 1);
  settle();
  for (std::size_t i = 0; i < process_->queues->workQueueCount(); ++i) {
    while (process_->queues->workQueue(i)->fireTimer(300 * kSecond)) settle();
  }
  notePurges();
  if (!has("recent") || isInTrouble || faults() > 0 || before > 0 || mode_ != FaultMode::OneFault) return;
  EXPECT_EQ(store("recent").getAllKeys(), std::vector<std::string>{"late"});
}

void ScriptedWorkload::clear() {
  if (!has("recent")) return;
  bool isCleared = false;
  attempt([&] { store("recent").clear([&] { isCleared = true; }, [&](const std::exception&) { ++complaints_; }); });
  mayGo("recent");
  settle();
  notePurges();
  if (isCleared && purges_["recent"] == 0) {
    for (auto& [key, remembered] : memory_["recent"]) remembered.values.clear();
  }
  put("recent", "after", 1);
}

void ScriptedWorkload::flush() {
  for (std::size_t i = 0; i < process_->queues->workQueueCount(); ++i) {
    process_->queues->workQueue(i)->fireTimer(120 * kSecond);
  }
  settle();
}

void ScriptedWorkload::emptyTrash() {
  settle();
  process_->runQueuesAtOnce(true);
  attempt([&] { process_->trash->emptyAllTrash(); });
  process_->runQueuesAtOnce(false);
}

void ScriptedWorkload::survive() {
  clock_.advance(7200);
  files->total = 1LL << 20;
  mayGo("thumbs");
  put("thumbs", "last", 1);
  mayGo("thumbs");
  settle();
  files->total = 1LL << 40;
}

void ScriptedWorkload::markForTrash() {
  const auto media = process_->managers.find("media");
  if (media == process_->managers.end()) return;
  mayGo("thumbs");
  attempt([&] { media->second->trashStoreOnStartup("thumbs"); });
}

void ScriptedWorkload::invalidate() {
  settle();
  mayGo("notes");
  process_->runQueuesAtOnce(true);
  attempt([&] { process_->sessionScoped->invalidate(); });
  process_->runQueuesAtOnce(false);
  settle();
  process_->stores.erase("notes");
  process_->managers.erase("inbox");
}

void ScriptedWorkload::fetchAll() {
  for (const auto& [store, keys] : memory_) {
    for (const auto& [key, remembered] : keys) fetch(store, key);
  }
}

void ScriptedWorkload::fillAgain() {
  put("letters", "d", 3);
  put("letters", "a", 3);
  put("settings", "d", 3);
  put("notes", "b", 3);
  drop("letters", "b");
}

// Two writes and a removal share a transaction.
void ScriptedWorkload::changeAtOnce() {
  for (const char* name : {"letters", "settings"}) {
    if (!has(name)) continue;
    const Asked overwritten = ask(name, "a", 6);
    const Asked added = ask(name, "f", 6);
    drop(name, "d");
    take(overwritten);
    take(added);
  }
}

// The process ends while writes wait for the file queue. What has not begun by then has not happened.
void ScriptedWorkload::closeInTheMiddle() {
  const std::vector<Asked> asked = askForMany(4);
  for (std::size_t i = 0; i < process_->queues->workQueueCount(); ++i) runAll(*process_->queues->workQueue(i));
  for (std::size_t i = 0; i < process_->queues->queueCount(); ++i) runNext(*process_->queues->queue(i));
  std::vector<Asked> notBegun;
  for (const Asked& write : asked) {
    write.written->isPending() ? notBegun.push_back(write) : take(write);
  }
  process_->letGo();
  process_->dropAll();
  notePurges();
  process_.reset();
  for (const Asked& write : notBegun) forget(write);
  start();
  for (const Asked& write : asked) fetch(write.store, write.key);
}

// Nobody holds a manager or a store any more while writes wait, but the queues run on: what was accepted is done.
void ScriptedWorkload::letGoInTheMiddle() {
  const std::vector<Asked> asked = askForMany(5);
  process_->letGo();
  settle();
  for (const Asked& write : asked) take(write);
  process_.reset();
  start();
  for (const Asked& write : asked) fetch(write.store, write.key);
}

// --- What is done with a store ---

void ScriptedWorkload::put(const std::string& name, const std::string& key, int version) {
  if (!has(name)) return;
  const Asked asked = ask(name, key, version);
  settle();
  take(asked);
}

ScriptedWorkload::Asked ScriptedWorkload::ask(const std::string& name, const std::string& key, int version) {
  const std::string value = valueOf(name + "/" + key, version);
  return {name, key, value, watch(store(name).store(key, bytesOf(value))), purges(name), faults()};
}

// Overwrites, and a first write or two.
std::vector<ScriptedWorkload::Asked> ScriptedWorkload::askForMany(int version) {
  std::vector<Asked> asked;
  for (const char* key : {"a", "b", "d"}) {
    for (const char* name : {"letters", "settings", "notes"}) {
      if (has(name)) asked.push_back(ask(name, key, version));
    }
  }
  return asked;
}

// What follows from the answer.
void ScriptedWorkload::take(const Asked& asked) {
  const std::string& name = asked.store;
  notePurges();
  ASSERT_FALSE(asked.written->isPending()) << name << " " << asked.key;

  Remembered& remembered = memory_[name][asked.key];
  remembered.everWritten.insert(asked.value);
  if (asked.written->hasSucceeded() && purges(name) == asked.purgesBefore) {
    remembered.values = {asked.value};
    remembered.mayBeMissing = remembered.mayFail = remembered.mayBeTorn = false;
    // A limit may take it at any time from here on.
    if (name == "thumbs") remembered.mayBeMissing = true;
    return;
  }
  if (!asked.written->hasSucceeded()) ++complaints_;
  if (mode_ == FaultMode::ManifestClosed) return;
  remembered.values.insert(asked.value);
  if (isSafe_) return;  // the former value stays, unless this one turns up in the manifest's log
  remembered.mayBeMissing = true;
  if (mode_ != FaultMode::OneFault) remembered.mayFail = remembered.mayBeTorn = true;
}

// What follows when the process ends before the writer is called: nothing, unless a fault was in the way of that.
void ScriptedWorkload::forget(const Asked& asked) {
  Remembered& remembered = memory_[asked.store][asked.key];
  remembered.everWritten.insert(asked.value);
  if (isSafe_) {  // where there is no manifest, its file may be found, and is a whole value
    if (faults() > 0) remembered.values.insert(asked.value);
    return;
  }
  if (isInTrouble || faults() > asked.faultsBefore) remembered.mayBeMissing = remembered.mayFail = true;
}

void ScriptedWorkload::fetch(const std::string& name, const std::string& key) {
  if (!has(name)) return;
  const std::size_t faultsBefore = faults();
  const Fetched fetched = watch(store(name).fetch(key));
  settle();
  notePurges();
  ASSERT_FALSE(fetched->isPending()) << name << " " << key;
  const std::string answer = told(fetched);
  if (!fetched->hasSucceeded()) ++complaints_;
  const bool isTrouble = answer == "<miss>" || !fetched->hasSucceeded();
  if (isTrouble && (isInTrouble || faults() > faultsBefore)) return;  // no value may be wrong for all that
  expectAllIsAnswered(name, key, answer);
}

void ScriptedWorkload::expectAllIsAnswered(const std::string& name, const std::string& key, const std::string& answer) {
  const Remembered& remembered = memory_[name][key];
  if (answer == "<miss>") {
    if (remembered.mayBeMissing) return;
    if (mode_ == FaultMode::SilentLoss) {
      ++silentlyMissing_;
    } else {
      ADD_FAILURE() << name << " " << key << " is missing";
    }
  } else if (answer.rfind("<error>", 0) == 0) {
    // A row that SQLite did not find when it was removed is back, without its file.
    const bool isBack = isSafe_ && mode_ == FaultMode::SilentLoss && remembered.mayBeMissing;
    EXPECT_TRUE(remembered.mayFail || isBack) << name << " " << key << ": " << answer;
  } else {
    const bool isWhole = remembered.values.count(answer) > 0;
    EXPECT_TRUE(isWhole || (remembered.mayBeTorn && isPrefixOfOne(answer, remembered.everWritten)))
        << name << " " << key << " is '" << answer << "'";
  }
}

void ScriptedWorkload::drop(const std::string& name, const std::string& key) {
  if (!has(name)) return;
  const std::size_t purgesBefore = purges(name);
  const Written removed = watch(store(name).removeItem(key));
  settle();
  notePurges();
  ASSERT_FALSE(removed->isPending()) << name << " " << key;
  Remembered& remembered = memory_[name][key];
  remembered.mayBeMissing = true;
  if (removed->hasSucceeded() && purges(name) == purgesBefore) {
    remembered.values.clear();  // what was removed does not come back
    remembered.mayFail = remembered.mayBeTorn = false;
  } else if (!removed->hasSucceeded()) {
    ++complaints_;
  }
}

// --- Holding it to its promises ---

void ScriptedWorkload::verify() {
  vfs.heal();
  files->heal();
  files->onCall = nullptr;
  if (process_ != nullptr) {
    const testing::ScopedTrace trace(__FILE__, __LINE__, "in the same process");
    expectNewWorkSucceeds();
    fetchAll();
  }
  const testing::ScopedTrace trace(__FILE__, __LINE__, "after a restart");
  restart();
  for (const std::string& name : kStores) EXPECT_TRUE(has(name)) << name;
  EXPECT_NE(process_->web, nullptr);
  fetchAll();
  expectNewWorkSucceeds();
  expectDatabasesAreSound();
  fetchAll();
}

void ScriptedWorkload::expectNewWorkSucceeds() {
  ++freshVersion_;
  for (const std::string& name : kStores) {
    if (!has(name)) continue;
    const std::string value = valueOf(name, freshVersion_);
    if (name == "recent") mayGo(name);  // at its capacity
    const Written written = watch(store(name).store("fresh", bytesOf(value)));
    settle();
    EXPECT_EQ(told(written), "<done>") << name;
    Remembered& remembered = memory_[name]["fresh"];
    remembered = {{value}, {value}, name == "thumbs", false, false};
    const Fetched fetched = watch(store(name).fetch("fresh"));
    settle();
    if (name != "thumbs" || told(fetched) != "<miss>") {
      EXPECT_EQ(told(fetched), value) << name;
    }
  }
}

void ScriptedWorkload::expectDatabasesAreSound() {
  if (mode_ == FaultMode::SilentLoss) return;  // SQLite could not know, and has gone on from what it read
  for (const auto& [name, opened] : process_->stores) {
    sqlite3* database = nullptr;
    const std::string path = opened->path + "/manifest_v1.sqlite";
    ASSERT_EQ(sqlite3_open_v2(path.c_str(), &database, SQLITE_OPEN_READWRITE, nullptr), SQLITE_OK) << path;
    EXPECT_EQ(oneAnswer(database, "PRAGMA integrity_check"), "ok") << name;
    EXPECT_EQ(oneAnswer(database, "SELECT ifnull(SUM(size), 0) FROM LarderManifest"),
              std::to_string(opened->getManifest()->size()))
        << name;
    sqlite3_close(database);
  }
}

void ScriptedWorkload::expectEachPurgeIsReported() const {
  for (const std::string& name : kStores) {
    if (name == "thumbs") continue;  // goes to the trash for its mark, too
    EXPECT_EQ(purges(name), purgeLines(lineOf(name)) - linesBeforeStart_.at(name)) << name;
  }
}

bool ScriptedWorkload::hasReportedTrouble() const { return complaints_ > 0 || log_.errorCount() > 0; }

std::size_t ScriptedWorkload::discards() const { return purgeLines(""); }

bool ScriptedWorkload::has(const std::string& name) const {
  return process_ != nullptr && process_->stores.count(name) > 0;
}

PersistentKeyValueStore& ScriptedWorkload::store(const std::string& name) const { return *process_->stores.at(name); }

// A purge hands the store's directory to the collector.
std::size_t ScriptedWorkload::purges(const std::string& name) const {
  const auto path = process_->paths.find(name);
  if (path == process_->paths.end()) return 0;
  const auto collected = process_->trash->collected();
  return static_cast<std::size_t>(std::count(collected.begin(), collected.end(), path->second));
}

std::size_t ScriptedWorkload::purgeLines(const std::string& beginning) const {
  const auto lines = log_.messages();
  return static_cast<std::size_t>(std::count_if(lines.begin(), lines.end(), [&](const std::string& line) {
    return line.rfind(beginning, 0) == 0 && line.find(" purged due to corrupted manifest. ") != std::string::npos;
  }));
}

void ScriptedWorkload::notePurges() {
  if (process_ == nullptr) return;
  for (const std::string& name : kStores) {
    const std::size_t now = purges(name);
    const bool isPurged = now != std::exchange(purges_[name], now);
    const bool isHarmed = isPurged || (mode_ == FaultMode::SilentLoss && !isSafe_ && faults() > 0);
    if (isHarmed) mayGo(name);
    if (!isHarmed || mode_ == FaultMode::OneFault) continue;
    for (auto& [key, remembered] : memory_[name]) remembered.mayFail = true;
  }
}

void ScriptedWorkload::mayGo(const std::string& name) {
  for (auto& [key, remembered] : memory_[name]) remembered.mayBeMissing = true;
}

// --- Running ---

void ScriptedWorkload::attempt(const std::function<void()>& work) {
  try {
    work();
  } catch (const std::exception&) {
    ++complaints_;
  }
}

void ScriptedWorkload::settle() {
  for (bool ran = true; ran;) {
    ran = false;
    for (const auto& queue : process_->executors()) ran = runNext(*queue) || ran;
  }
}

void ScriptedWorkload::runAll(ManualExecutor& queue) {
  while (runNext(queue)) continue;
}

bool ScriptedWorkload::runNext(ManualExecutor& queue) {
  try {
    return queue.runNext();
  } catch (const LarderException& error) {
    ++complaints_;
    EXPECT_TRUE(mayThrow_) << "left its task: " << error.what();
    return true;
  }
}

std::size_t ScriptedWorkload::faults() const { return vfs.failures() + files->failures(); }

}  // namespace velmora::mobile::xplat::cellar::test
