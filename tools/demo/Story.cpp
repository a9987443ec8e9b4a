#include "demo/Story.h"

#include <algorithm>
#include <array>
#include <exception>
#include <filesystem>
#include <memory>
#include <string_view>
#include <utility>

#include "Console.h"
#include "ExtendedMetadata.h"
#include "Progress.h"
#include "Stopwatch.h"
#include "Table.h"
#include "TextFile.h"
#include "host/Await.h"
#include "storage/Layout.h"
#include "storage/StoreFiles.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

constexpr std::size_t kMostRequestsAtOnce = 32;
constexpr std::array<const char*, 3> kKinds = {"unmanaged", "key-value", "disk cache"};  // by the type of the store

// The stores with keys in turn, and what they take. The caches stay within their manager's limit.
struct Shelf {
  const char* store;
  std::uint64_t largest;    // bytes of a value
  std::uint64_t mostBytes;  // of all values
};
constexpr std::array<Shelf, 4> kShelves = {{{"thumbnails", 32U << 10U, 24U << 20U},
                                            {"videos", 64U << 10U, 24U << 20U},
                                            {"settings", 4U << 10U, 512U << 10U},
                                            {"drafts", 0, 0}}};  // what the others have no room for

std::size_t digestOf(const Bytes& bytes) {
  return std::hash<std::string_view>()({reinterpret_cast<const char*>(bytes.data()), bytes.size()});
}

// The regular files of a tree, without those in which the library keeps attributes and records.
TreeSize sizeOfTree(const std::string& directory) {
  TreeSize size;
  walkTree(directory, [&](const std::string& below, const Entry& entry) {
    const bool isLibrarys = isAttributesFile(entry) || isManifestFile(below);
    if (entry.type == Entry::Type::File && !isLibrarys) size += {1, entry.size};
  });
  return size;
}

}  // namespace

// False when it could not be played to its end: those after it have nothing to build on.
bool Story::playScene(const std::string& title, void (Story::*scene)()) {
  console_.heading(title);
  const std::size_t passedBefore = passed_;
  const std::size_t failedBefore = failed_;
  std::string end = "reached";
  try {
    (this->*scene)();
    noteFullest();
  } catch (const std::exception& error) {
    end = error.what();
  }
  check("end of the scene", "reached", end);
  const std::vector<std::string> errors = app_.takeErrors();
  check("errors in the log", 0, errors.size());
  for (const std::string& error : errors) console_.bad("       " + error);
  if (failed_ == failedBefore) console_.good(formatCount(passed_ - passedBefore, "check", "checks") + " passed");
  return end == "reached";
}

void Story::start(const std::string& release, const std::string& user) {
  app_.stop();
  const Stopwatch watch;
  app_.launch(release, user);
  app_.openStores();
  console_.line("release " + release + " has opened " + formatCount(app_.stores().size(), "store", "stores") + " for " +
                user + " in " + formatTime(watch.elapsed()));
}

// Gives each unmanaged store that is empty an even share of the source files, or so many pictures as covers.
void Story::fillEmptyDirectories(std::size_t mostFiles, std::size_t covers) {
  const std::size_t share = source_.files.size() / app_.unmanagedStores().size();
  const Stopwatch watch;
  Progress progress(console_, "writing files");
  TreeSize written;
  std::size_t next = 0;
  for (const std::string& store : app_.unmanagedStores()) {
    if (!records_[store].contents.empty()) continue;
    const bool areCovers = store == "covers";
    const std::size_t files = areCovers ? covers : std::clamp<std::size_t>(share, 1, mostFiles);
    for (std::size_t i = 0; i < files; ++i) {
      const SourceFiles::File& file = source_.files[next++ % source_.files.size()];
      const Bytes contents = areCovers ? pictureOf(file, kPicture) : contentsOf(file);
      writeFile(store, areCovers ? std::to_string(i) + ".img" : file.name, contents);
      progress.advanceTo(i, files);
    }
    written += sizeOf(store);
  }
  console_.line("the application has written " + formatFiles(written) + " in " + formatTime(watch.elapsed()));
  checkEverything();
}

// As an application does it: past Cellar.
void Story::writeFile(const std::string& store, const std::string& name, const Bytes& contents) {
  const std::string path = app_.pathOf(store) + "/" + name;
  fs::create_directories(fs::path(path).parent_path());
  writeTextFile(path, {contents.begin(), contents.end()});
  records_[store].contents[name] = {contents.size(), digestOf(contents)};
}

// By key, each in a store that has room for it. Where they are few, small pictures made of them follow.
std::size_t Story::storeFiles() {
  const std::size_t files = source_.files.size();
  const std::size_t values = std::max<std::size_t>(files, 1000);
  Progress progress(console_, "storing files");
  std::map<std::string, std::uint64_t> bytes;
  for (std::size_t i = 0; i < values; ++i) {
    const SourceFiles::File& file = source_.files[i % files];
    const Bytes contents = i < files ? contentsOf(file) : pictureOf(file, kSmallPicture);
    const Shelf& shelf = kShelves[i % kShelves.size()];
    const bool hasRoom = contents.size() <= shelf.largest && bytes[shelf.store] + contents.size() <= shelf.mostBytes;
    store(hasRoom ? shelf.store : "drafts", "file-" + std::to_string(i), contents);
    if (hasRoom) bytes[shelf.store] += contents.size();
    progress.advanceTo(i, values);
  }
  finishRequests();
  return values;
}

// Pictures, or chunks of a video, until the store exceeds the limit, and no further; one at the least, so that the
// manager hears of the store.
void Story::storeUntilOver(std::uint64_t limit, const std::string& name) {
  std::size_t number = 0;
  do {
    const SourceFiles::File& file = source_.files[number % source_.files.size()];
    store(name, "new-" + std::to_string(number++), pictureOf(file, kPicture));
    finishRequests();
  } while (sizeOf(name).bytes <= limit);
  noteFullest();
}

void Story::store(const std::string& store, const std::string& key, const Bytes& contents) {
  Record& record = records_[store];
  std::shared_ptr<DiskCacheItem::ExtendedMetadata> metadata;
  if (store == "videos") {
    const auto second = static_cast<int>(record.contents.size() % 60);
    metadata =
        std::make_shared<VideoDownloadExtendedMetadata>(second, VideoDownloadExtendedMetadata::ItemType::VideoChunk);
  }
  record.contents[key] = {contents.size(), digestOf(contents)};
  ++record.stored;
  addRequest([request = app_.values(store)->store(key, contents, metadata)] { host::await(request); });
}

void Story::fetch(const std::string& store, const std::string& key) {
  addRequest([this, store, key, request = app_.values(store)->fetch(key)] {
    checkFetched(store, key, host::await(request).get());
  });
}

void Story::addRequest(std::function<void()> finish) {
  underWay_.push_back(std::move(finish));
  if (underWay_.size() == kMostRequestsAtOnce) finishRequests();
}

void Story::finishRequests() {
  for (const auto& finish : std::exchange(underWay_, {})) finish();
  app_.settle();
}

// Strikes out what the store has lost, or is about to lose; how much that is.
TreeSize Story::forget(const std::string& store) {
  const TreeSize size = sizeOf(store);
  records_[store].contents.clear();
  return size;
}

TreeSize Story::forgetSession() {
  TreeSize size;
  for (const auto& store : app_.stores()) {
    const auto manager = app_.configuration().getManager(store->managerName);
    if (manager->sessionScoped) size += forget(store->name);
  }
  return size;
}

// Strikes out the values that the store has let go of by itself; how many those are.
std::size_t Story::forgetMissing(const std::string& store) {
  auto& contents = records_[store].contents;
  const auto noted = std::exchange(contents, {});
  for (const std::string& key : app_.values(store)->getAllKeys()) contents[key] = noted.at(key);
  return noted.size() - contents.size();
}

void Story::check(const std::string& what, const std::string& expected, const std::string& found) {
  ++(found == expected ? passed_ : failed_);
  if (found != expected) console_.bad("FAILED " + what + ": expected " + expected + ", found " + found);
}

void Story::checkFetched(const std::string& store, const std::string& key,
                         const PersistentKeyValueStore::FetchResult* found) {
  Record& record = records_[store];
  ++(found == nullptr ? record.misses : record.hits);
  const auto note = record.contents.find(key);
  const bool isRight = note == record.contents.end()
                           ? found == nullptr
                           : found != nullptr && found->key == key && found->value.size() == note->second.bytes &&
                                 digestOf(found->value) == note->second.digest;
  check(key + " of " + store + " is fetched as it was stored", isRight);
}

// Each store holds what the application has noted, by its own account and on disk, and nothing else is left.
void Story::checkEverything() {
  finishRequests();
  for (const std::string& name : app_.storesWithKeys()) {
    std::vector<std::string> keys = app_.values(name)->getAllKeys();
    std::sort(keys.begin(), keys.end());
    check("the keys in " + name + " are those that were stored", keys == keysOf(name));
  }
  for (const auto& store : app_.stores()) {
    const bool isInManifest = store->name == "settings";
    const TreeSize expected = isInManifest ? TreeSize() : sizeOf(store->name);
    const TreeSize found = sizeOfTree(app_.pathOf(store->name));
    check("files in " + store->name, expected.files, found.files);
    check("bytes in " + store->name, expected.bytes, found.bytes);
  }
  checkDirectories();
}

// There are none of other releases and users, and no trash.
void Story::checkDirectories() {
  std::size_t directories = 0;
  for (const ManagerPlace& manager : findLayout(root_).managers) {
    check(relativeTo(root_, manager.path) + " holds stores", !manager.stores.empty());
    directories += manager.stores.size();
  }
  check("directories of stores", app_.stores().size(), directories);
  check("the trash is empty", !fs::exists(fs::path(root_) / "trash"));
}

// The managers have reported these stores with these sizes, and no others.
void Story::checkEvents(const std::string& type, const std::multimap<std::string, std::uint64_t>& sizes) {
  std::multimap<std::string, std::uint64_t> found;
  auto events = app_.events();
  for (const JsonValue& event : events["qzdiskstore_logging"]) {
    if (event.at("event_type") != type) continue;
    const auto store = event.at("store_name").get<std::string>();
    found.emplace(store, event.at("current_size").get<std::uint64_t>());
    check("limit of " + store + " in the event", app_.definition(store).maxSize,
          event.at("max_size").get<std::uint64_t>());
  }
  check("the events of type " + type + " are those of the stores with their sizes", found == sizes);
}

void Story::noteFullest() {
  for (auto& [store, record] : records_) {
    const TreeSize size = sizeOf(store);
    if (size.bytes > record.fullest.bytes || size.files > record.fullest.files) record.fullest = size;
  }
}

TreeSize Story::sizeOf(const std::string& store) {
  TreeSize size;
  for (const auto& content : records_[store].contents) size += {1, content.second.bytes};
  return size;
}

std::vector<std::string> Story::keysOf(const std::string& store) {
  std::vector<std::string> keys;
  for (const auto& content : records_[store].contents) keys.push_back(content.first);
  return keys;
}

void Story::printStores() {
  std::vector<Table::Column> columns;
  for (const char* title : {"manager", "kind", "directory"}) columns.push_back({title, Table::Align::Left});
  for (const char* title : {"files", "size", "max size", "left", "stored", "hits", "misses"}) {
    columns.push_back({title, Table::Align::Right});
  }
  Table table(std::move(columns));
  for (const auto& store : app_.stores()) {
    const Record& record = records_[store->name];
    table.addRow({store->managerName, kKinds.at(static_cast<std::size_t>(store->type)),
                  relativeTo(root_, app_.pathOf(store->name)), formatCount(record.fullest.files),
                  formatSize(record.fullest.bytes), store->maxSize == 0 ? "none" : formatSize(store->maxSize),
                  formatSize(sizeOf(store->name).bytes), formatCount(record.stored), formatCount(record.hits),
                  formatCount(record.misses)});
  }
  console_.heading("The stores: their files or values at the fullest, what is left, and what was asked of them");
  console_.raw(table.text());
}

void Story::printEvents() const {
  Table table({{"event", Table::Align::Left}, {"count", Table::Align::Right}});
  for (const auto& [name, payloads] : app_.events()) table.addRow({name, formatCount(payloads.size())});
  console_.heading("The events that were reported to analytics");
  console_.raw(table.text());
}

}  // namespace velmora::mobile::xplat::cellar::tools
