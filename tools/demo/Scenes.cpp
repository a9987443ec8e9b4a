#include <algorithm>
#include <chrono>
#include <cmath>
#include <exception>
#include <filesystem>
#include <future>
#include <iterator>
#include <random>
#include <stdexcept>
#include <thread>
#include <utility>

#include "Console.h"
#include "DiskCacheManifest.h"
#include "DiskSizeCalculator.h"
#include "LarderException.h"
#include "PruneStrategy.h"
#include "Stopwatch.h"
#include "StoreManager.h"
#include "TrashCollector.h"
#include "demo/Story.h"
#include "host/Await.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

constexpr std::size_t kPicture = 256U << 10U;
constexpr std::size_t kSmallPicture = 4U << 10U;
constexpr std::size_t kSomeFiles = 200;
constexpr std::int32_t kDay = 86400;

// Files and directories of a tree, itself included.
std::uint64_t entriesOf(const fs::path& directory) {
  const fs::recursive_directory_iterator entries(directory);
  return 1 + static_cast<std::uint64_t>(std::distance(begin(entries), end(entries)));
}

// Waits for the timers and tasks that bring it about, a minute at the most.
template <class Condition> bool comesAbout(const Condition& condition) {
  const Stopwatch watch;
  while (!condition() && watch.elapsed() < std::chrono::minutes(1)) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  return condition();
}

template <class Operation> bool isRefused(const Operation& operation) {
  try {
    operation();
    return false;
  } catch (const InvalidatedException&) {
    return true;
  }
}

}  // namespace

const std::vector<Story::Scene>& Story::scenes() {
  static const std::vector<Scene> scenes = {
      {"The first start", &Story::startFirst},
      {"Files fill the unmanaged stores", &Story::fillDirectories},
      {"The unmanaged stores are measured, and measured again", &Story::measure},
      {"A cache over its limit is evicted at the next start", &Story::evictCovers},
      {"Files are stored by key: thumbnails, videos, drafts, settings", &Story::storeByKey},
      {"Values are fetched in a skewed order", &Story::fetchByKey},
      {"Disk caches over their limits are pruned", &Story::pruneCaches},
      {"After a restart, every value is found again", &Story::findAgain},
      {"Values that have not been used for long expire", &Story::expireThumbnails},
      {"A store is cleared", &Story::clearThumbnails},
      {"An update retires the directories of the old release", &Story::updateApplication},
      {"Another user starts, and the first one's data is cleaned up", &Story::changeUser},
      {"A store that is marked for trashing is empty at the next start", &Story::trashDownloads},
      {"A forced cleanse discards everything", &Story::cleanse},
      {"Trash that a power cut left behind is removed", &Story::emptyTrash},
      {"The user logs out", &Story::logOut},
  };
  return scenes;
}

void Story::startFirst() {
  start("100", "alice");
  std::map<std::string, std::string> names;  // of the stores, by the directory of their manager
  for (const auto& store : app_.stores()) {
    const fs::path path = app_.pathOf(store->name);
    check(store->name + " has its directory", fs::is_directory(path));
    check(store->name + " has a temporary directory",
          fs::is_directory(app_.host().managerOfStore(store->name)->getTemporaryDirectory()));
    std::string& line = names[path.parent_path()];
    if (line.empty()) line = below(path.parent_path()) + "/";
    line.append("  ").append(path.filename().string());
  }
  for (const auto& line : names) console_.line(line.second);
  checkEverything();
}

void Story::fillDirectories() {
  fillEmptyDirectories(SourceFiles::kMostFiles, 125);
  for (const auto& [store, size] : directories_) console_.line(store + ": " + formatFiles(size));
}

void Story::measure() {
  for (const bool isKept : {false, true}) {
    const Stopwatch watch;
    TreeSize total;
    for (const auto& [store, size] : directories_) {
      const auto measured = app_.host().sizes()->calculateDirectorySize(app_.pathOf(store));
      check("measured files of " + store, size.files, static_cast<std::uint64_t>(measured.fileCount));
      check("measured bytes of " + store, size.bytes, static_cast<std::uint64_t>(measured.size));
      check("the figures of " + store + " are " + (isKept ? "kept" : "fresh"), measured.valid == isKept);
      total += size;
    }
    console_.line(formatFiles(total) + (isKept ? " are known from kept figures in " : " are counted in ") +
                  formatTime(watch.elapsed()));
  }
}

void Story::evictCovers() {
  const TreeSize before = directories_["covers"];
  const std::uint64_t limit = app_.definition("covers").maxSize;
  check("covers are over their limit", before.bytes > limit);
  restart();
  directories_["covers"] = {};
  console_.line("covers held " + formatSize(before.bytes) + " and may hold " + formatSize(limit) +
                ": they are empty now, and the other stores are unchanged");
  checkEverything();
  checkEvents("eviction", {{"covers", before.bytes}});
}

void Story::storeByKey() {
  const Stopwatch watch;
  std::size_t values = 0;
  for (const auto& [name, placed] : placeFiles()) {
    store(name, placed);
    values += placed.size();
  }
  console_.line(formatCount(values, "file is", "files are") + " stored in " + formatTime(watch.elapsed()));
  const auto& definition = dynamic_cast<const PKVSDefinition&>(app_.definition("settings"));
  const auto capacity = static_cast<std::size_t>(definition.capacity.value());
  const std::size_t settings = notes_["settings"].size();
  dropMissing("settings");
  check("values left in settings", std::min(settings, capacity), notes_["settings"].size());
  for (const auto& notes : notes_) console_.line(notes.first + ": " + formatFiles(sizeOf(notes.first)));
  if (settings > capacity) {
    console_.line("settings has reached its capacity of " + formatCount(capacity) + " values, so older ones had to go");
  }
  checkEverything();
}

// The nth most popular value is asked for in proportion to 1/n. A few requests are for keys that nobody has stored.
void Story::fetchByKey() {
  std::vector<std::pair<std::string, std::string>> popular;
  for (const auto& notes : notes_) {
    for (const std::string& key : keysOf(notes.first)) popular.emplace_back(notes.first, key);
  }
  std::mt19937_64 random(20240229);
  for (std::size_t left = popular.size(); left > 1; --left) std::swap(popular[left - 1], popular[random() % left]);
  std::map<std::string, std::vector<std::string>> wanted;
  for (std::size_t i = 0; i < popular.size(); ++i) {
    const double share = static_cast<double>(random() >> 11U) * 0x1p-53;
    const auto rank = static_cast<std::size_t>(std::pow(static_cast<double>(popular.size()), share)) - 1;
    const auto& [name, key] = popular[rank];
    wanted[name].push_back(key);
    if (i % 50 == 0) wanted[name].push_back("unknown-" + std::to_string(i));
  }
  const Stopwatch watch;
  for (const auto& [name, keys] : wanted) fetch(name, keys);
  console_.line("the application has fetched " + formatCount(requests(&Requests::hits)) + " values in " +
                formatTime(watch.elapsed()) + ", each of them as it was stored, and has missed " +
                formatCount(requests(&Requests::misses)) + " unknown ones");

  const std::string removed = keysOf("drafts").front();
  host::await(app_.values("drafts")->removeItem(removed));
  notes_["drafts"].erase(removed);
  fetch("drafts", {removed});
  console_.line(removed + " is removed, and fetching it is a miss from then on");
  checkEverything();
}

void Story::pruneCaches() {
  VideoDownloadPruneStrategy::priorityWeight = 3600;
  VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = 10;
  const std::uint64_t limit = app_.host().configuration()->getManager("player")->maxSize;
  storeUntilOver(app_.definition("thumbnails").maxSize, "thumbnails", 0);
  console_.line("thumbnails are over their limit, but their manager is within its own, so nothing is pruned");
  checkEverything();
  storeUntilOver(limit, "videos", sizeOf("thumbnails").bytes);
  const std::map<std::string, std::uint64_t> sizes = {{"thumbnails", sizeOf("thumbnails").bytes},
                                                      {"videos", sizeOf("videos").bytes}};
  check("the pruning ends", app_.settle());
  checkEvents("pruning", sizes);
  console_.line("with the chunks of another video their manager is over its limit of " + formatSize(limit));
  for (const auto& [name, size] : sizes) {
    const std::size_t gone = dropMissing(name);
    const std::uint64_t own = app_.definition(name).maxSize;
    check("values of " + name + " are pruned", gone > 0);
    check(name + " are within their limit", sizeOf(name).bytes <= own);
    check(name + " are not pruned much further", sizeOf(name).bytes + kPicture > own);
    console_.line(name + ": " + formatCount(gone, "value was", "values were") + " pruned, " +
                  formatFiles(sizeOf(name)) + " of at most " + formatSize(own) + " remain");
  }
  checkEverything();
}

void Story::findAgain() {
  restart();
  checkEverything();
  const Stopwatch watch;
  const std::size_t values = fetchAll();
  console_.line("the application has fetched all " + formatCount(values, "value", "values") + " in " +
                formatTime(watch.elapsed()) + ", each of them as it was stored");
}

void Story::expireThumbnails() {
  const auto thumbnails = app_.values("thumbnails");
  std::vector<std::string> old;
  for (const std::string& key : keysOf("thumbnails")) {
    if (old.size() * 2 >= notes_["thumbnails"].size()) break;
    const auto item = thumbnails->getManifest()->getItem(key);
    item->lastAccessDate -= 31 * kDay;
    thumbnails->getManifest()->setItem(*item);
    old.push_back(key);
  }
  console_.line(formatCount(old.size(), "thumbnail is", "thumbnails are") + " dated back by 31 days");
  checkEverything();
  for (const std::string& key : old) notes_["thumbnails"].erase(key);
  thumbnails->scheduleStaleRemoval(0);
  const std::size_t remaining = notes_["thumbnails"].size();
  check("old thumbnails expire", comesAbout([&] { return thumbnails->getAllKeys().size() == remaining; }));
  console_.line("they are past their stale age of 30 days and have expired; " + formatCount(remaining) +
                " others remain");
  checkEverything();
}

void Story::clearThumbnails() {
  const std::vector<std::string> keys = keysOf("thumbnails");
  std::promise<void> over;
  app_.values("thumbnails")
      ->clear([&] { over.set_value(); },
              [&](const std::exception& error) {
                over.set_exception(std::make_exception_ptr(std::runtime_error(error.what())));
              });
  over.get_future().get();
  notes_["thumbnails"].clear();
  console_.line("thumbnails are cleared; every other store is unchanged");
  checkEverything();
  fetch("thumbnails", keys);
  store("thumbnails", {{"first-again", 0, kSmallPicture}});
  fetch("thumbnails", {"first-again"});
  console_.line("the old thumbnails are misses, and a new one is stored and fetched");
  checkEverything();
}

void Story::updateApplication() {
  std::vector<std::string> retired;
  for (const auto& store : app_.stores()) {
    if (store->hasVersion) continue;
    retired.push_back(app_.pathOf(store->name));
    forget(*store);
  }
  start("101", app_.user());
  for (const std::string& directory : retired) console_.line(below(directory) + " is retired");
  checkGone(retired);
  checkEverything();
}

void Story::changeUser() {
  const std::string before = app_.user();
  const std::vector<std::string> directories = sessionDirectories();
  const TreeSize size = forgetSession();
  start(app_.release(), "bob");
  console_.line(before + "'s " + formatFiles(size) + " are gone; what belongs to no session is unchanged");
  checkGone(directories);
  checkEverything();
  fillEmptyDirectories(kSomeFiles, 50);
}

void Story::trashDownloads() {
  app_.host().managerOfStore("downloads")->trashStoreOnStartup("downloads");
  console_.line("downloads is marked for trashing, and still holds " + formatFiles(directories_["downloads"]));
  checkEverything();
  restart();
  directories_["downloads"] = {};
  console_.line("downloads is empty now");
  checkEverything();
}

void Story::cleanse() {
  TreeSize discarded;
  for (const auto& store : app_.stores()) {
    discarded += sizeOf(store->name);
    forget(*store);
  }
  StoreManager::setForceCleanseOnInit(true);
  restart();
  StoreManager::setForceCleanseOnInit(false);
  console_.line("the managers have discarded " + formatFiles(discarded) + " as they started");
  checkEverything();
}

void Story::emptyTrash() {
  fillEmptyDirectories(kSomeFiles, 50);
  const fs::path trash = fs::path(root_) / "trash";
  const fs::path previews = app_.pathOf("previews");
  app_.stop();
  // A collector that is killed right after its rename leaves just this.
  fs::create_directory(trash);
  fs::rename(previews, trash / "0123456789abcdef");
  const std::uint64_t entries = entriesOf(trash);
  directories_["previews"] = {};

  app_.launch(app_.release(), app_.user());
  const Stopwatch watch;
  app_.host().trash()->emptyAllTrash();
  console_.line(formatCount(entries, "entry is", "entries are") + " removed in " + formatTime(watch.elapsed()));
  const std::vector<JsonValue> reports = eventsNamed("qztrash_collector");
  check("emptyings reported", 1, reports.size());
  for (const JsonValue& report : reports) {
    check("entries reported", entries, report.at("file_count").get<std::uint64_t>());
  }
  app_.openStores();
  checkEverything();
}

void Story::logOut() {
  for (const char* name : {"thumbnails", "drafts"}) {
    std::vector<Value> pictures;
    for (std::size_t i = 0; i < kSomeFiles / 2; ++i) {
      pictures.push_back({"picture-" + std::to_string(i), i % source_.files.size(), kSmallPicture});
    }
    store(name, pictures);
  }
  checkEverything();
  const std::vector<std::string> directories = sessionDirectories();
  const auto drafts = app_.values("drafts");
  const auto manager = app_.host().managerOfStore("drafts");
  const Stopwatch watch;
  app_.host().logOut();
  console_.line(app_.user() + "'s data (" + formatFiles(forgetSession()) + ") is out of its place in " +
                formatTime(watch.elapsed()));
  checkGone(directories);
  check("the manager of the session is invalid", !manager->isValid());
  check("a store of the session refuses to store", isRefused([&] { host::await(drafts->store("key", {})); }));
  check("a store of the session refuses to fetch", isRefused([&] { host::await(drafts->fetch("key")); }));
  console_.line("a store of the session that somebody still holds refuses to store and to fetch");
  fetch("thumbnails", keysOf("thumbnails"));
  console_.line("what belongs to no session is fetched as before");
  app_.openStores();
  checkEverything();
}

}  // namespace velmora::mobile::xplat::cellar::tools
