#include <algorithm>
#include <chrono>
#include <cmath>
#include <exception>
#include <filesystem>
#include <future>
#include <iterator>
#include <random>
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
#include "storage/Layout.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace fs = std::filesystem;

namespace {

constexpr std::size_t kSomeFiles = 200;

template <class T> bool isRefused(const Future<T>& request) {
  try {
    (void)host::await(request);
    return false;
  } catch (const InvalidatedException&) {
    return true;
  }
}

}  // namespace

void Story::play() {
  static constexpr std::pair<const char*, void (Story::*)()> scenes[] = {
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
  std::size_t number = 0;
  for (const auto& [title, scene] : scenes) {
    if (!playScene(std::to_string(++number) + ". " + title, scene)) return;
  }
  printStores();
  app_.stop();
  printEvents();
}

void Story::startFirst() {
  start("100", "alice");
  const Layout layout = findLayout(root_);
  for (const ManagerPlace& manager : layout.managers) {
    std::string line = relativeTo(layout.root, manager.path) + "/";
    for (const StorePlace& store : manager.stores) line.append("  ").append(store.name);
    console_.line(line);
  }
  for (const auto& store : app_.stores()) {
    check(store->name + " has a temporary directory",
          fs::is_directory(app_.host().managerOfStore(store->name)->getTemporaryDirectory()));
  }
  checkEverything();
}

void Story::fillDirectories() {
  fillEmptyDirectories(SourceFiles::kMostFiles, 40);
  for (const std::string& store : app_.unmanagedStores()) console_.line(store + ": " + formatFiles(sizeOf(store)));
}

void Story::measure() {
  for (const bool isKept : {false, true}) {
    const Stopwatch watch;
    TreeSize total;
    for (const std::string& store : app_.unmanagedStores()) {
      const TreeSize size = sizeOf(store);
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
  const TreeSize before = forget("covers");
  const std::uint64_t limit = app_.definition("covers").maxSize;
  check("covers are over their limit", before.bytes > limit);
  restart();
  console_.line("covers held " + formatSize(before.bytes) + " and may hold " + formatSize(limit) +
                ": they are empty now, and the other stores are unchanged");
  checkEverything();
  checkEvents("eviction", {{"covers", before.bytes}});
}

void Story::storeByKey() {
  const Stopwatch watch;
  const std::size_t values = storeFiles();
  console_.line(formatCount(values, "file is", "files are") + " stored in " + formatTime(watch.elapsed()));
  const auto& settings = dynamic_cast<const PKVSDefinition&>(app_.definition("settings"));
  const auto capacity = static_cast<std::uint64_t>(settings.capacity.value());
  const std::uint64_t stored = sizeOf("settings").files;
  const std::size_t gone = forgetMissing("settings");
  check("values left in settings", std::min(stored, capacity), stored - gone);
  for (const std::string& name : app_.storesWithKeys()) console_.line(name + ": " + formatFiles(sizeOf(name)));
  console_.line("settings may hold " + formatCount(capacity) + " values, so " +
                formatCount(gone, "older one", "older ones") + " had to go");
  checkEverything();
}

// The nth most popular value is asked for in proportion to 1/n. A few requests are for keys that nobody has stored.
void Story::fetchByKey() {
  std::vector<std::pair<std::string, std::string>> popular;
  for (const std::string& name : app_.storesWithKeys()) {
    for (const std::string& key : keysOf(name)) popular.emplace_back(name, key);
  }
  std::mt19937_64 random(20240229);
  std::shuffle(popular.begin(), popular.end(), random);
  std::uniform_real_distribution<double> share;
  std::size_t unknown = 0;
  const Stopwatch watch;
  for (std::size_t i = 0; i < popular.size(); ++i) {
    const double rank = std::pow(static_cast<double>(popular.size()), share(random));
    const auto& [name, key] = popular[static_cast<std::size_t>(rank) - 1];
    fetch(name, key);
    if (i % 50 == 0) fetch(name, "unknown-" + std::to_string(unknown++));
  }
  finishRequests();
  console_.line("the application has fetched " + formatCount(popular.size()) + " values in " +
                formatTime(watch.elapsed()) + ", each of them as it was stored, and has missed " +
                formatCount(unknown) + " unknown ones");

  const std::string removed = keysOf("drafts").front();
  host::await(app_.values("drafts")->removeItem(removed));
  records_["drafts"].contents.erase(removed);
  fetch("drafts", removed);
  console_.line(removed + " is removed, and fetching it is a miss from then on");
  checkEverything();
}

void Story::pruneCaches() {
  VideoDownloadPruneStrategy::priorityWeight = 3600;
  VideoDownloadPruneStrategy::highPriorityVideoSecondCutoff = 10;
  storeUntilOver(app_.definition("thumbnails").maxSize, "thumbnails");
  console_.line("thumbnails are over their limit, but their manager is within its own, so nothing is pruned");
  checkEverything();
  const std::uint64_t limit = app_.configuration().getManager("player")->maxSize;
  storeUntilOver(limit - sizeOf("thumbnails").bytes, "videos");
  checkEvents("pruning", {{"thumbnails", sizeOf("thumbnails").bytes}, {"videos", sizeOf("videos").bytes}});
  console_.line("with the chunks of another video their manager is over its limit of " + formatSize(limit));
  for (const char* const name : {"thumbnails", "videos"}) {
    const std::size_t gone = forgetMissing(name);
    const TreeSize left = sizeOf(name);
    const std::uint64_t own = app_.definition(name).maxSize;
    check(std::string("values of ") + name + " are pruned", gone > 0);
    check(std::string(name) + " are within their limit", left.bytes <= own);
    check(std::string(name) + " are not pruned much further", left.bytes + kPicture > own);
    console_.line(std::string(name) + ": " + formatCount(gone, "value was", "values were") + " pruned, " +
                  formatFiles(left) + " of at most " + formatSize(own) + " remain");
  }
  checkEverything();
}

void Story::findAgain() {
  restart();
  checkEverything();
  const Stopwatch watch;
  std::uint64_t values = 0;
  for (const std::string& name : app_.storesWithKeys()) {
    for (const std::string& key : keysOf(name)) fetch(name, key);
    values += sizeOf(name).files;
  }
  finishRequests();
  console_.line("the application has fetched all " + formatCount(values, "value", "values") + " in " +
                formatTime(watch.elapsed()) + ", each of them as it was stored");
}

void Story::expireThumbnails() {
  const auto thumbnails = app_.values("thumbnails");
  std::vector<std::string> old = keysOf("thumbnails");
  const std::size_t remaining = old.size() / 2;
  old.resize(old.size() - remaining);
  for (const std::string& key : old) {
    const auto item = thumbnails->getManifest()->getItem(key);
    item->lastAccessDate -= 31 * 86400;
    thumbnails->getManifest()->setItem(*item);
  }
  console_.line(formatCount(old.size(), "thumbnail is", "thumbnails are") + " dated back by 31 days");
  checkEverything();
  for (const std::string& key : old) records_["thumbnails"].contents.erase(key);
  thumbnails->scheduleStaleRemoval(0);
  const Stopwatch watch;
  while (thumbnails->getAllKeys().size() > remaining && watch.elapsed() < std::chrono::minutes(1)) {
    std::this_thread::sleep_for(std::chrono::milliseconds(10));
  }
  checkEverything();
  console_.line("they are past their stale age of 30 days and have expired; " + formatCount(remaining) +
                " others remain");
}

void Story::clearThumbnails() {
  const std::vector<std::string> keys = keysOf("thumbnails");
  std::promise<std::string> over;
  app_.values("thumbnails")
      ->clear([&] { over.set_value("no error"); }, [&](const std::exception& error) { over.set_value(error.what()); });
  const std::string outcome = over.get_future().get();
  check("clearing ends with " + outcome, outcome == "no error");
  forget("thumbnails");
  console_.line("thumbnails are cleared; every other store is unchanged");
  checkEverything();
  for (const std::string& key : keys) fetch("thumbnails", key);
  store("thumbnails", "first-again", pictureOf(source_.files.front(), kSmallPicture));
  fetch("thumbnails", "first-again");
  checkEverything();
  console_.line("the old thumbnails are misses, and a new one is stored and fetched");
}

void Story::updateApplication() {
  for (const auto& store : app_.stores()) {
    if (store->hasVersion) continue;
    console_.line(relativeTo(root_, app_.pathOf(store->name)) + " is about to be retired");
    forget(store->name);
  }
  start("101", app_.user());
  checkEverything();
}

void Story::changeUser() {
  const TreeSize size = forgetSession();
  start(app_.release(), "bob");
  checkEverything();
  console_.line("alice's " + formatFiles(size) + " are gone; what belongs to no session is unchanged");
  fillEmptyDirectories(kSomeFiles, 16);
}

void Story::trashDownloads() {
  app_.host().managerOfStore("downloads")->trashStoreOnStartup("downloads");
  console_.line("downloads is marked for trashing, and still holds " + formatFiles(sizeOf("downloads")));
  checkEverything();
  restart();
  forget("downloads");
  checkEverything();
  console_.line("downloads is empty now");
}

void Story::cleanse() {
  TreeSize discarded;
  for (const auto& store : app_.stores()) discarded += forget(store->name);
  StoreManager::setForceCleanseOnInit(true);
  restart();
  StoreManager::setForceCleanseOnInit(false);
  console_.line("the managers have discarded " + formatFiles(discarded) + " as they started");
  checkEverything();
}

void Story::emptyTrash() {
  fillEmptyDirectories(kSomeFiles, 16);
  const fs::path trash = fs::path(root_) / "trash";
  const fs::path previews = app_.pathOf("previews");
  app_.stop();
  // A collector that is killed right after its rename leaves just this.
  fs::create_directory(trash);
  fs::rename(previews, trash / "0123456789abcdef");
  forget("previews");
  const fs::recursive_directory_iterator inTrash(trash);
  const auto entries = 1 + static_cast<std::uint64_t>(std::distance(begin(inTrash), end(inTrash)));

  app_.launch(app_.release(), app_.user());
  const Stopwatch watch;
  app_.host().trash()->emptyAllTrash();
  console_.line(formatCount(entries, "entry is", "entries are") + " removed in " + formatTime(watch.elapsed()));
  const std::vector<JsonValue> reports = app_.events()["qztrash_collector"];
  check("emptyings reported", 1, reports.size());
  check("entries reported", entries, reports.at(0).at("file_count").get<std::uint64_t>());
  app_.openStores();
  checkEverything();
}

void Story::logOut() {
  for (std::size_t i = 0; i < kSomeFiles / 2; ++i) {
    const Bytes picture = pictureOf(source_.files[i % source_.files.size()], kSmallPicture);
    store("thumbnails", "picture-" + std::to_string(i), picture);
    store("drafts", "picture-" + std::to_string(i), picture);
  }
  checkEverything();
  const auto drafts = app_.values("drafts");
  const auto manager = app_.host().managerOfStore("drafts");
  const Stopwatch watch;
  app_.host().logOut();
  console_.line(app_.user() + "'s data (" + formatFiles(forgetSession()) + ") is out of its place in " +
                formatTime(watch.elapsed()));
  for (const ManagerPlace& place : findLayout(root_).managers) {
    check(relativeTo(root_, place.path) + " belongs to no session", place.isSessionless());
  }
  check("the manager of the session is invalid", !manager->isValid());
  check("a store of the session refuses to store", isRefused(drafts->store("key", {})));
  check("a store of the session refuses to fetch", isRefused(drafts->fetch("key")));
  console_.line("a store of the session that somebody still holds refuses to store and to fetch");
  for (const std::string& key : keysOf("thumbnails")) fetch("thumbnails", key);
  finishRequests();
  console_.line("what belongs to no session is fetched as before");
  app_.openStores();
  checkEverything();
}

}  // namespace velmora::mobile::xplat::cellar::tools
