#include "acceptance/MediaApp.h"

#include <gmock/gmock.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <future>
#include <iterator>
#include <regex>
#include <thread>
#include <utility>

#include "AttributeStore.h"
#include "ExtendedMetadata.h"
#include "JsonValue.h"
#include "PruneStrategy.h"
#include "StoreManager.h"
#include "host/Await.h"
#include "support/ManifestOnDisk.h"

namespace velmora::mobile::xplat::cellar::acceptance {

namespace fs = std::filesystem;

using host::await;
using testing::ElementsAreArray;
using testing::UnorderedElementsAreArray;

namespace {

constexpr std::int64_t kTick = 10;
constexpr std::int64_t kNanoseconds = 1'000'000'000;
constexpr int kLastEarlySecond = 10;  // of a video
constexpr int kGrace = 205;           // seconds; no multiple of a tick, so that no two ranks are equal

struct StoreOfTheApp {
  const char* manager;
  const char* directory;
  bool hasKeys;
};

// Worked out from the document by hand, and not asked of the library.
const std::map<std::string, StoreOfTheApp> kStores = {
    {"covers", {"feed", "caches/_store_{user}/covers_{release}_v1", false}},
    {"previews", {"feed", "caches/_store_{user}/previews_{release}_v1", false}},
    {"thumbnails", {"player", "caches/_sessionlessStore/thumbnails_v1", true}},
    {"videos", {"player", "caches/_sessionlessStore/videos_{release}_v1", true}},
    {"downloads", {"library", "documents/_store_{user}/downloads_v3", false}},
    {"drafts", {"library", "documents/_store_{user}/drafts_v1", true}},
    {"subtitles", {"library", "documents/_store_{user}/subtitles_en_US_v1", false}},
    {"catalogue", {"device", "shared/_sessionlessStore/catalogue_en_US_{release}_v1", false}},
    {"fonts", {"device", "shared/_sessionlessStore/fonts_v2", false}},
    {"settings", {"device", "shared/_sessionlessStore/settings_v1", true}},
};

bool isInline(const std::string& store) { return store == "settings"; }
bool isSafe(const std::string& store) { return store == "drafts"; }

// Whose value a file has, by its name: in a safe store a number and a checksum follow the key.
std::string keyIn(const std::string& store, const std::string& filename) {
  if (!isSafe(store)) return filename;
  std::smatch parts;
  const bool isNamed = std::regex_match(filename, parts, std::regex("(.*)\\.[0-9]+\\.[0-9a-f]{8}"));
  return isNamed ? parts[1].str() : filename + " has no number and checksum";
}

std::vector<std::string> storesThat(bool haveKeys) {
  std::vector<std::string> names;
  for (const auto& [name, store] : kStores) {
    if (store.hasKeys == haveKeys) names.push_back(name);
  }
  return names;
}

std::string configuration() {
  std::ifstream in(CELLAR_SOURCE_DIR "/examples/media-app.json");
  const std::string text{std::istreambuf_iterator<char>(in), std::istreambuf_iterator<char>()};
  return std::regex_replace(text, std::regex("MB\""), "KB\"");
}

// Of no other key, and not the same for another length.
std::string contentsFor(const std::string& name, std::size_t bytes) {
  std::string contents;
  while (contents.size() < bytes) contents += name + '\0' + std::to_string(bytes) + '\n';
  return contents.substr(0, bytes);
}

// What a tree holds by path, without the files that the library keeps attributes in.
std::map<std::string, std::string> treeOf(const std::string& directory) {
  std::map<std::string, std::string> files;
  for (const auto& entry : fs::recursive_directory_iterator(directory)) {
    if (!entry.is_regular_file() || entry.path().filename() == AttributeStore::fileName) continue;
    std::ifstream in(entry.path(), std::ios::binary);
    files[entry.path().lexically_relative(directory)] = {std::istreambuf_iterator<char>(in),
                                                         std::istreambuf_iterator<char>()};
  }
  return files;
}

}  // namespace

// --- The model ---

void ModelOfValues::put(const std::string& key, const Item& item) {
  const auto isOlder = [](const auto& a, const auto& b) { return a.second.used < b.second.used; };
  if (capacity && items.size() >= *capacity) items.erase(std::min_element(items.begin(), items.end(), isOlder));
  items[key] = item;
}

std::vector<std::string> ModelOfValues::prune(std::size_t limit) {
  std::vector<std::string> gone;
  while (bytes() > limit) {
    gone.push_back(firstToGo());
    items.erase(gone.back());
  }
  return gone;
}

void ModelOfValues::expire(std::int64_t date) {
  for (auto item = items.begin(); item != items.end();) {
    item = item->second.used < date ? items.erase(item) : std::next(item);
  }
}

std::size_t ModelOfValues::bytes() const {
  std::size_t bytes = 0;
  for (const auto& item : items) bytes += item.second.value.size();
  return bytes;
}

std::vector<std::string> ModelOfValues::keys() const {
  std::vector<std::string> keys;
  for (const auto& item : items) keys.push_back(item.first);
  return keys;
}

std::string ModelOfValues::firstToGo() const {
  const auto rank = [this](const Item& item) {
    return item.used + (item.second && *item.second <= kLastEarlySecond ? grace : 0);
  };
  const auto goesBefore = [&](const auto& a, const auto& b) { return rank(a.second) < rank(b.second); };
  return std::min_element(items.begin(), items.end(), goesBefore)->first;
}

// --- The life of the application ---

MediaApp::MediaApp() {
  VideoDownloadPruneStrategy::priorityWeight = kGrace;
  VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = kLastEarlySecond;
  for (const std::string& store : keyedStores()) values_[store] = {};
  values_["settings"].capacity = 64;
  values_["videos"].grace = kGrace;
}

MediaApp::~MediaApp() {
  if (host_ != nullptr) stop();
  VideoDownloadPruneStrategy::priorityWeight = 0;
  VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = 0;
}

void MediaApp::start() {
  launch();
  openStores();
}

void MediaApp::launch() {
  tick();
  files_ = std::make_shared<test::DiskOfChosenSize>();
  queues_ = std::make_shared<test::ManualQueueFactory>();
  host::HostOptions options;
  options.configuration = configuration();
  options.root = directory_.path();
  options.versionTag = release_;
  options.localeFirstTag = "en";
  options.localeSecondTag = "US";
  options.analytics = std::make_unique<test::RecordingAnalytics>(events_);
  options.fileUtils = files_;
  options.taskQueueFactory = queues_;
  host_ = std::make_unique<host::Host>(std::move(options));
}

void MediaApp::openStores() const {
  for (const auto& store : kStores) managerOf(store.first)->getStore<Store>(store.first);
  settle();
}

void MediaApp::stop() {
  settle();
  host_.reset();
  settle();
  queues_.reset();
}

void MediaApp::restart() {
  stop();
  start();
}

void MediaApp::settle() const { queues_->runAll(); }

void MediaApp::fireTimers(long seconds) const {
  for (const auto& queue : queues_->all()) queue->fireTimer(seconds * kNanoseconds);
  settle();
}

void MediaApp::runBeside(const std::function<void()>& operation) const {
  const auto over = std::async(std::launch::async, operation);
  while (over.wait_for(std::chrono::seconds(0)) != std::future_status::ready) {
    settle();
    std::this_thread::yield();
  }
}

void MediaApp::tick() { clock_.set(now_ += kTick); }

// --- The stores ---

std::shared_ptr<PersistentKeyValueStore> MediaApp::open(const std::string& store) const {
  return host_->store<PersistentKeyValueStore>(store, user_);
}

std::shared_ptr<StoreManager> MediaApp::managerOf(const std::string& store) const {
  return host_->manager(kStores.at(store).manager, user_);
}

std::string MediaApp::directoryOf(const std::string& store) const {
  const std::string withUser = std::regex_replace(kStores.at(store).directory, std::regex("\\{user\\}"), user_);
  return std::regex_replace(withUser, std::regex("\\{release\\}"), release_);
}

std::string MediaApp::pathOf(const std::string& store) const { return directory_.file(directoryOf(store)); }

std::vector<std::string> MediaApp::unmanagedStores() const { return storesThat(false); }
std::vector<std::string> MediaApp::keyedStores() const { return storesThat(true); }

// --- What the application does ---

void MediaApp::write(const std::string& store, const std::string& name, std::size_t bytes) {
  written_[store][name] = contentsFor(name, bytes);
  directory_.write(directoryOf(store) + "/" + name, written_[store][name]);
}

void MediaApp::fillEverything() {
  for (const std::string& store : unmanagedStores()) {
    write(store, "first", 700);
    write(store, "deep/er/second", 300);
    write(store, "empty", 0);
  }
  for (const std::string& store : keyedStores()) {
    for (std::size_t i = 0; i < 5; ++i) put(store, store + "-" + std::to_string(i), i * 100);
  }
}

void MediaApp::put(const std::string& store, const std::string& key, std::size_t bytes, std::optional<int> second) {
  tick();
  const std::string text = contentsFor(key, bytes);
  const Bytes value(text.begin(), text.end());
  std::shared_ptr<DiskCacheItem::ExtendedMetadata> metadata;
  if (second) {
    metadata =
        std::make_shared<VideoDownloadExtendedMetadata>(*second, VideoDownloadExtendedMetadata::ItemType::VideoChunk);
  }
  const auto stored = open(store)->store(key, value, metadata);
  settle();
  await(stored);
  values_[store].put(key, {value, now_, now_, second});
}

void MediaApp::remove(const std::string& store, const std::string& key) {
  const auto removed = open(store)->removeItem(key);
  settle();
  await(removed);
  values_[store].items.erase(key);
}

void MediaApp::expectFetched(const std::string& store, const std::string& key) {
  tick();
  const auto fetched = open(store)->fetch(key);
  settle();
  const auto found = await(fetched);
  const auto item = values_[store].items.find(key);
  const bool isHit = item != values_[store].items.end();
  ++(isHit ? hits_ : misses_);
  ASSERT_EQ(found != nullptr, isHit) << store << " " << key;
  if (!isHit) return;
  EXPECT_EQ(found->key, key);
  EXPECT_EQ(found->value, item->second.value) << store << " " << key;
  EXPECT_EQ(found->modificationDate, item->second.stored) << store << " " << key;
  item->second.used = now_;
}

void MediaApp::forget(const std::string& store) {
  values_[store].items.clear();
  written_[store].clear();
}

void MediaApp::forgetBelow(const std::string& beginning) {
  for (const auto& store : kStores) {
    if (directoryOf(store.first).rfind(beginning, 0) == 0) forget(store.first);
  }
}

// --- What is there ---

void MediaApp::expectAsModelled() {
  settle();
  for (const std::string& store : unmanagedStores()) EXPECT_EQ(treeOf(pathOf(store)), written_[store]) << store;
  for (const std::string& store : keyedStores()) expectKeysAndFiles(store);
  EXPECT_FALSE(exists("trash"));
  EXPECT_EQ(log_.errorCount(), 0U) << testing::PrintToString(log_.messages());
}

void MediaApp::expectKeysAndFiles(const std::string& store) const {
  const ModelOfValues& model = values_.at(store);
  EXPECT_THAT(open(store)->getAllKeys(), UnorderedElementsAreArray(model.keys())) << store;
  std::map<std::string, Bytes> files;
  for (const auto& [key, item] : model.items) {
    if (!isInline(store)) files[key] = item.value;
  }
  std::map<std::string, Bytes> found;
  for (const auto& [name, bytes] : test::valueFiles(pathOf(store))) {
    EXPECT_TRUE(found.emplace(keyIn(store, name), bytes).second) << store << " has two files for the key of " << name;
  }
  EXPECT_EQ(found, files) << store;
}

void MediaApp::expectAllFetched() {
  for (const std::string& store : keyedStores()) {
    for (const std::string& key : values_[store].keys()) expectFetched(store, key);
  }
}

void MediaApp::expectRowsAsModelled() const {
  for (const std::string& store : keyedStores()) {
    const auto rows = test::ManifestOnDisk(pathOf(store)).rows();
    const auto& items = values_.at(store).items;
    EXPECT_EQ(rows.size(), items.size()) << store;
    for (const auto& [key, row] : rows) {
      ASSERT_EQ(items.count(key), 1U) << store << " " << key;
      const ModelOfValues::Item& item = items.at(key);
      EXPECT_EQ(keyIn(store, row.filename), key);
      EXPECT_EQ(row.size, item.value.size()) << key;
      EXPECT_EQ(row.isInline, isInline(store)) << key;
      EXPECT_EQ(row.inlineData, isInline(store) ? item.value : Bytes()) << key;
      EXPECT_EQ(row.modificationDate, item.stored) << key;
      EXPECT_EQ(row.lastAccessDate, item.used) << key;
    }
  }
}

void MediaApp::backdate(const std::string& store, const std::string& key, std::int64_t date) {
  test::ManifestOnDisk(pathOf(store)).setLastAccessDate(key, date);
  values_[store].items.at(key).used = date;
}

std::vector<std::string> MediaApp::managerEvents(const std::string& type) const {
  std::vector<std::string> events;
  for (const test::LoggedEvent& event : events_->named("qzdiskstore_logging")) {
    const JsonValue json = event.json();
    if (json.at("event_type") != type) continue;
    events.push_back(json.at("store_name").get<std::string>() + " " + json.at("current_size").dump() + " " +
                     json.at("max_size").dump());
  }
  return events;
}

std::vector<std::string> MediaApp::deletedFilesOf(const std::string& store) const {
  const std::string beginning = "deleteFile " + pathOf(store) + "/";
  std::vector<std::string> names;
  for (const std::string& call : files_->trace()) {
    if (call.rfind(beginning, 0) == 0) names.push_back(call.substr(beginning.size()));
  }
  return names;
}

}  // namespace velmora::mobile::xplat::cellar::acceptance
