#include "demo/Story.h"

#include <algorithm>
#include <array>
#include <cerrno>
#include <exception>
#include <filesystem>
#include <fstream>
#include <limits>
#include <memory>
#include <stdexcept>
#include <string_view>
#include <system_error>
#include <utility>

#include "AttributeStore.h"
#include "Console.h"
#include "ExtendedMetadata.h"
#include "Progress.h"
#include "Stopwatch.h"
#include "Table.h"
#include "host/Await.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

constexpr std::size_t kMostUnderWay = 32;  // requests at once
constexpr std::size_t kPicture = 256U << 10U;
constexpr const char* kManifest = "manifest_v1.sqlite";

// Values that are stored at the least, and bytes that may be stored again and again to reach that number.
constexpr std::size_t kFewestValues = 1000;
constexpr std::uint64_t kMostRepeatedBytes = 8U << 20U;

// A store with keys, and what it takes. Most files become thumbnails and chunks of videos as long as they are small
// enough, many become drafts, and some of the smallest settings. The caches stay within their manager's limit.
struct Shelf {
  const char* store;
  const char* prefix;       // of its keys
  std::uint64_t largest;    // bytes of a value
  std::uint64_t mostBytes;  // of all values
  std::size_t mostValues;
  bool areChunks;
};

constexpr std::uint64_t kAny = std::numeric_limits<std::uint64_t>::max() / 2;
constexpr std::size_t kMany = std::numeric_limits<std::size_t>::max();
constexpr std::array<Shelf, 4> kShelves = {{{"thumbnails", "thumbnail-", 32U << 10U, 24U << 20U, kMany, false},
                                            {"videos", "chunk-", 64U << 10U, 24U << 20U, kMany, true},
                                            {"drafts", "draft-", kAny, kAny, kMany, false},
                                            {"settings", "setting-", 4U << 10U, kAny, 128, false}}};
constexpr const Shelf& kDrafts = kShelves[2];

std::size_t digestOf(const Bytes& bytes) {
  return std::hash<std::string_view>()({reinterpret_cast<const char*>(bytes.data()), bytes.size()});
}

// The regular files of a tree, without those in which the library keeps attributes and records.
TreeSize sizeOfTree(const std::string& directory) {
  TreeSize size;
  for (const fs::directory_entry& entry : fs::recursive_directory_iterator(directory)) {
    const std::string name = entry.path().filename().string();
    if (entry.is_symlink() || !entry.is_regular_file() || name == AttributeStore::fileName) continue;
    if (name.rfind(kManifest, 0) != 0) size += {1, entry.file_size()};
  }
  return size;
}

std::string kindOf(const StoreDefinition& store) {
  if (store.type == StoreDefinition::Type::PKVS) return "key-value";
  if (store.type == StoreDefinition::Type::DiskCache) return "disk cache";
  return store.isCache ? "unmanaged cache" : "unmanaged";
}

std::string limitOf(const StoreDefinition& store) {
  if (store.maxSize > 0) return formatSize(store.maxSize);
  const auto* const keyValue = dynamic_cast<const PKVSDefinition*>(&store);
  if (keyValue == nullptr || !keyValue->capacity) return "none";
  return formatCount(static_cast<std::uint64_t>(*keyValue->capacity), "value", "values");
}

bool isInline(const StoreDefinition& store) {
  const auto* const keyValue = dynamic_cast<const PKVSDefinition*>(&store);
  return keyValue != nullptr && keyValue->inlineData;
}

}  // namespace

Story::Story(Console& console, const SourceFiles& source, const std::string& root)
    : console_(console), source_(source), root_(root), app_(root) {}

void Story::play() {
  std::size_t number = 0;
  for (const Scene& scene : scenes()) {
    console_.heading(std::to_string(++number) + ". " + scene.title);
    if (!playScene(scene)) return;
  }
  printStores();
  app_.stop();
  printEvents();
}

// False when it could not be played to its end: those after it have nothing to build on.
bool Story::playScene(const Scene& scene) {
  const std::size_t passedBefore = passed_;
  const std::size_t failedBefore = failed_;
  bool isOver = false;
  try {
    (this->*scene.play)();
    noteSizes();
    isOver = true;
  } catch (const std::exception& error) {
    fail("end of the scene", "reached", error.what());
  }
  const std::vector<std::string> errors = app_.takeErrors();
  check("errors in the log", 0, errors.size());
  for (const std::string& error : errors) console_.bad("       " + error);
  if (failed_ == failedBefore) console_.good(formatCount(passed_ - passedBefore, "check", "checks") + " passed");
  return isOver;
}

// --- What the scenes are made of ---

void Story::start(const std::string& release, const std::string& user) {
  app_.stop();
  const Stopwatch watch;
  app_.launch(release, user);
  app_.openStores();
  console_.line("release " + release + " has opened " + formatCount(app_.stores().size(), "store", "stores") + " for " +
                user + " in " + formatTime(watch.elapsed()));
}

void Story::restart() { start(app_.release(), app_.user()); }

// Gives each unmanaged store that is empty an even share of the source files, and the covers pictures for so many
// percent of their limit.
void Story::fillEmptyDirectories(std::size_t mostFiles, std::uint64_t coversPercent) {
  std::vector<std::string> stores;
  for (const auto& store : app_.stores()) {
    if (!store->isManaged) stores.push_back(store->name);
  }
  const Stopwatch watch;
  Progress progress(console_, "writing files");
  TreeSize written;
  for (std::size_t part = 0; part < stores.size(); ++part) {
    TreeSize& size = directories_[stores[part]];
    if (size.files > 0) continue;
    const bool areCovers = stores[part] == "covers";
    const std::size_t count = source_.files.size();
    const std::size_t first = count * part / stores.size();
    const std::size_t share = std::clamp<std::size_t>(count * (part + 1) / stores.size() - first, 1, mostFiles);
    const std::size_t files = areCovers ? app_.definition("covers").maxSize * coversPercent / 100 / kPicture : share;
    for (std::size_t i = 0; i < files; ++i) {
      const SourceFiles::File& file = source_.files[(first + i) % count];
      const Bytes contents = areCovers ? pictureOf(file, kPicture) : tools::contentsOf(file);
      copyFile(app_.pathOf(stores[part]) + "/" + (areCovers ? std::to_string(i) + ".img" : file.name), contents);
      size += {1, contents.size()};
      progress.advanceTo(size.files, files);
    }
    written += size;
  }
  console_.line("the application has written " + formatFiles(written) + " in " + formatTime(watch.elapsed()));
  checkEverything();
}

// As an application does it: with the standard library, past Cellar.
void Story::copyFile(const std::string& path, const Bytes& contents) {
  fs::create_directories(fs::path(path).parent_path());
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(reinterpret_cast<const char*>(contents.data()), static_cast<std::streamsize>(contents.size()));
  out.close();
  if (!out) throw std::runtime_error("cannot write '" + path + "': " + std::generic_category().message(errno));
}

// Few files are placed several times.
Story::Values Story::placeFiles() const {
  constexpr std::array<std::size_t, 10> turns = {0, 1, 2, 3, 0, 1, 2, 0, 1, 0};
  Values values;
  std::map<std::string, std::uint64_t> bytes;
  std::uint64_t repeated = 0;
  const std::size_t files = source_.files.size();
  for (std::size_t i = 0; i < std::max(files, kFewestValues); ++i) {
    const std::uint64_t size = source_.files[i % files].size;
    if (i >= files && repeated + size > kMostRepeatedBytes) continue;
    if (i >= files) repeated += size;
    const Shelf& wanted = kShelves[turns[i % turns.size()]];
    const bool hasRoom = size <= wanted.largest && bytes[wanted.store] + size <= wanted.mostBytes &&
                         values[wanted.store].size() < wanted.mostValues;
    const Shelf& shelf = hasRoom ? wanted : kDrafts;
    std::vector<Value>& placed = values[shelf.store];
    Value value{shelf.prefix + std::to_string(placed.size()), i % files};
    if (shelf.areChunks) value.second = static_cast<int>(placed.size() % 60);
    placed.push_back(value);
    bytes[shelf.store] += size;
  }
  return values;
}

void Story::store(const std::string& store, const std::vector<Value>& values) {
  const auto target = app_.values(store);
  Progress progress(console_, "storing " + store);
  std::size_t done = 0;
  std::vector<Future<void>> underWay;
  const auto finish = [&] {
    for (const Future<void>& write : underWay) host::await(write);
    requests_[store].stored += underWay.size();
    underWay.clear();
  };
  for (const Value& value : values) {
    const Bytes bytes = contentsOf(value);
    notes_[store][value.key] = {bytes.size(), digestOf(bytes)};
    std::shared_ptr<DiskCacheItem::ExtendedMetadata> metadata;
    if (value.second) {
      metadata = std::make_shared<VideoDownloadExtendedMetadata>(*value.second,
                                                                 VideoDownloadExtendedMetadata::ItemType::VideoChunk);
    }
    underWay.push_back(target->store(value.key, bytes, metadata));
    if (underWay.size() == kMostUnderWay) finish();
    progress.advanceTo(++done, values.size());
  }
  finish();
  app_.settle();
}

void Story::fetch(const std::string& store, const std::vector<std::string>& keys) {
  const auto source = app_.values(store);
  using Fetch = Future<std::unique_ptr<PersistentKeyValueStore::FetchResult>>;
  std::vector<std::pair<std::string, Fetch>> underWay;
  const auto finish = [&] {
    for (const auto& [key, fetch] : underWay) checkResult(store, key, host::await(fetch).get());
    underWay.clear();
  };
  for (const std::string& key : keys) {
    underWay.emplace_back(key, source->fetch(key));
    if (underWay.size() == kMostUnderWay) finish();
  }
  finish();
}

std::size_t Story::fetchAll() {
  std::size_t values = 0;
  for (const auto& notes : notes_) {
    fetch(notes.first, keysOf(notes.first));
    values += notes.second.size();
  }
  return values;
}

// Strikes out what the store has let go of; how many those are.
std::size_t Story::dropMissing(const std::string& store) {
  app_.settle();
  const std::vector<std::string> present = app_.values(store)->getAllKeys();
  Notes remaining;
  for (const std::string& key : present) {
    const auto note = notes_[store].find(key);
    if (note != notes_[store].end()) remaining.insert(*note);
  }
  const std::size_t gone = notes_[store].size() - remaining.size();
  notes_[store] = std::move(remaining);
  return gone;
}

void Story::forget(const StoreDefinition& store) {
  if (store.isManaged) {
    notes_[store.name].clear();
  } else {
    directories_[store.name] = {};
  }
}

// How much that was.
TreeSize Story::forgetSession() {
  TreeSize size;
  for (const auto& store : app_.stores()) {
    if (!app_.belongsToSession(*store)) continue;
    size += sizeOf(store->name);
    forget(*store);
  }
  return size;
}

// Chunks of a video, or pictures, until these and others exceed the limit, and no further; one at the least, so that
// the manager hears of the store.
void Story::storeUntilOver(std::uint64_t limit, const std::string& name, std::uint64_t others) {
  int number = 0;
  do {
    const std::size_t file = static_cast<std::size_t>(number) % source_.files.size();
    Value value{"new-" + std::to_string(number), file, kPicture};
    if (name == "videos") value.second = number;
    store(name, {value});
    ++number;
  } while (others + sizeOf(name).bytes <= limit);
  noteSizes();
}

// --- Checks ---

void Story::check(const std::string& what, bool isTrue) {
  if (!isTrue) return fail(what, "yes", "no");
  ++passed_;
}

void Story::check(const std::string& what, std::uint64_t expected, std::uint64_t found) {
  if (expected != found) return fail(what, std::to_string(expected), std::to_string(found));
  ++passed_;
}

void Story::fail(const std::string& what, const std::string& expected, const std::string& found) {
  ++failed_;
  console_.bad("FAILED " + what + ": expected " + expected + ", found " + found);
}

void Story::checkResult(const std::string& store, const std::string& key,
                        const PersistentKeyValueStore::FetchResult* found) {
  Requests& requests = requests_[store];
  ++(found == nullptr ? requests.misses : requests.hits);
  const auto note = notes_[store].find(key);
  const bool isRight = note == notes_[store].end()
                           ? found == nullptr
                           : found != nullptr && found->key == key && found->value.size() == note->second.bytes &&
                                 digestOf(found->value) == note->second.digest;
  check(key + " of " + store + " is fetched as it was stored", isRight);
}

// Each store holds what the application has noted, by its own account and on disk, and no trash is left.
void Story::checkEverything() {
  check("work in the background ends", app_.settle());
  for (const auto& store : app_.stores()) {
    const std::string& name = store->name;
    TreeSize expected = sizeOf(name);
    if (store->isManaged) {
      std::vector<std::string> keys = app_.values(name)->getAllKeys();
      std::sort(keys.begin(), keys.end());
      check("the keys in " + name + " are those that were stored", keys == keysOf(name));
      if (isInline(*store)) expected = {};
    }
    const TreeSize found = sizeOfTree(app_.pathOf(name));
    check("files in " + name, expected.files, found.files);
    check("bytes in " + name, expected.bytes, found.bytes);
  }
  check("the trash is empty", !fs::exists(fs::path(root_) / "trash"));
}

void Story::checkGone(const std::vector<std::string>& directories) {
  app_.settle();
  for (const std::string& directory : directories) check(below(directory) + " is gone", !fs::exists(directory));
}

// The managers have reported these stores with these sizes, and no others.
void Story::checkEvents(const std::string& type, const std::map<std::string, std::uint64_t>& sizes) {
  std::map<std::string, std::uint64_t> found;
  std::size_t count = 0;
  for (const JsonValue& event : eventsNamed("qzdiskstore_logging")) {
    if (event.at("event_type") != type) continue;
    const auto store = event.at("store_name").get<std::string>();
    found[store] = event.at("current_size").get<std::uint64_t>();
    check("limit of " + store + " in the event", app_.definition(store).maxSize,
          event.at("max_size").get<std::uint64_t>());
    ++count;
  }
  check("events of type " + type, sizes.size(), count);
  check("each event of type " + type + " has the size of its store", found == sizes);
}

// --- What is known ---

TreeSize Story::sizeOf(const std::string& store) {
  if (!app_.definition(store).isManaged) return directories_[store];
  TreeSize size;
  for (const auto& note : notes_[store]) size += {1, note.second.bytes};
  return size;
}

std::vector<std::string> Story::keysOf(const std::string& store) {
  std::vector<std::string> keys;
  for (const auto& note : notes_[store]) keys.push_back(note.first);
  return keys;
}

// Their payloads, oldest first.
std::vector<JsonValue> Story::eventsNamed(const std::string& name) const {
  std::vector<JsonValue> payloads;
  for (const JsonValue& event : app_.events()) {
    if (event.at("event") == name) payloads.push_back(event.at("payload"));
  }
  return payloads;
}

std::vector<std::string> Story::sessionDirectories() {
  std::vector<std::string> directories;
  for (const auto& store : app_.stores()) {
    if (app_.belongsToSession(*store)) directories.push_back(fs::path(app_.pathOf(store->name)).parent_path());
  }
  return directories;
}

std::size_t Story::requests(std::size_t Requests::*which) const {
  std::size_t sum = 0;
  for (const auto& requests : requests_) sum += requests.second.*which;
  return sum;
}

Bytes Story::contentsOf(const Value& value) const {
  const SourceFiles::File& file = source_.files[value.file];
  return value.pictureBytes > 0 ? pictureOf(file, value.pictureBytes) : tools::contentsOf(file);
}

std::string Story::below(const std::string& path) const { return fs::path(path).lexically_relative(root_).string(); }

void Story::noteSizes() {
  for (const auto& store : app_.stores()) {
    const TreeSize size = sizeOf(store->name);
    TreeSize& most = fullest_[store->name];
    if (size.bytes > most.bytes || size.files > most.files) most = size;
  }
}

void Story::printStores() {
  std::vector<Table::Column> columns;
  for (const char* title : {"manager", "kind", "directory"}) columns.push_back({title, Table::Align::Left});
  for (const char* title : {"files", "size", "limit", "left", "stored", "hits", "misses"}) {
    columns.push_back({title, Table::Align::Right});
  }
  Table table(std::move(columns));
  for (const auto& store : app_.stores()) {
    const TreeSize most = fullest_[store->name];
    const TreeSize left = sizeOf(store->name);
    const Requests& requests = requests_[store->name];
    const auto counted = [&](std::size_t count) { return store->isManaged ? formatCount(count) : "-"; };
    table.addRow({store->managerName, kindOf(*store), below(app_.pathOf(store->name)), formatCount(most.files),
                  formatSize(most.bytes), limitOf(*store), left.files == 0 ? "-" : formatSize(left.bytes),
                  counted(requests.stored), counted(requests.hits), counted(requests.misses)});
  }
  console_.heading("The stores: their files or values at the fullest, what is left, and what was asked of them");
  console_.raw(table.text());
}

void Story::printEvents() {
  Table table({{"event", Table::Align::Left}, {"count", Table::Align::Right}});
  std::map<std::string, std::size_t> counts;
  for (const JsonValue& event : app_.events()) ++counts[event.at("event").get<std::string>()];
  for (const auto& [name, count] : counts) table.addRow({name, formatCount(count)});
  console_.heading("The events that were reported to analytics");
  console_.raw(table.text());
}

}  // namespace velmora::mobile::xplat::cellar::tools
