#include <exception>
#include <filesystem>
#include <future>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "Console.h"
#include "Format.h"
#include "LarderException.h"
#include "Stopwatch.h"
#include "TrashCollector.h"
#include "demo/DemoContext.h"
#include "demo/DemoFilling.h"
#include "demo/DemoSteps.h"
#include "host/Await.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// A few files, and covers that stay within their limit.
constexpr Filling kSome{200, 50};

// Has every manager that is built meanwhile discard its directory first.
class ForcedCleanse {
 public:
  ForcedCleanse() { StoreManager::setForceCleanseOnInit(true); }
  ~ForcedCleanse() { StoreManager::setForceCleanseOnInit(false); }
  ForcedCleanse(const ForcedCleanse&) = delete;
  ForcedCleanse& operator=(const ForcedCleanse&) = delete;
};

void fillSome(DemoContext& context) {
  const TreeSize written = fillEmptyStores(context, kSome);
  context.console.line(formatFiles(written) + " written into the empty stores");
  context.checkContents();
}

std::vector<std::string> sessionDirectories(DemoContext& context) {
  std::vector<std::string> directories;
  for (const auto& store : context.stores()) {
    if (context.belongsToSession(*store)) directories.push_back(context.app().expectedManagerDirectory(*store));
  }
  return directories;
}

TreeSize sessionContents(DemoContext& context) {
  TreeSize size;
  for (const auto& store : context.stores()) {
    if (!context.belongsToSession(*store)) continue;
    size += store->isManaged ? context.clientOf(store->name).size() : context.contents[store->name];
  }
  return size;
}

void expectSessionEmpty(DemoContext& context) {
  for (const auto& store : context.stores()) {
    if (context.belongsToSession(*store)) context.expectEmpty(*store);
  }
}

void checkGone(DemoContext& context, const std::vector<std::string>& directories) {
  for (const std::string& directory : directories) {
    context.checks.isTrue(below(context.root, directory) + " is gone", !exists(directory));
  }
}

// What a store that is held on to says when it is asked for something after the end of its session.
template <class Operation> std::string refusalOf(Operation operation) {
  try {
    operation();
    return "no refusal";
  } catch (const InvalidatedException& refusal) {
    return refusal.description();
  }
}

std::string refusalOfClear(PersistentKeyValueStore& store) {
  return refusalOf([&] {
    const auto over = std::make_shared<std::promise<void>>();
    store.clear([over] { over->set_value(); },
                [over](const std::exception& error) {
                  const auto* const refusal = dynamic_cast<const InvalidatedException*>(&error);
                  if (refusal != nullptr) return over->set_exception(std::make_exception_ptr(*refusal));
                  over->set_value();
                });
    over->get_future().get();
  });
}

void checkRefusals(DemoContext& context, PersistentKeyValueStore& store, const std::string& key) {
  const std::vector<std::pair<std::string, std::string>> answers = {
      {"store", refusalOf([&] { host::await(store.store(key, {})); })},
      {"fetch", refusalOf([&] { host::await(store.fetch(key)); })},
      {"removeItem", refusalOf([&] { host::await(store.removeItem(key)); })},
      {"updateLastAccessDate", refusalOf([&] { host::await(store.updateLastAccessDate(key)); })},
      {"fetchModificationDate", refusalOf([&] { store.fetchModificationDate(key); })},
      {"getAllKeys", refusalOf([&] { store.getAllKeys(); })},
      {"clear", refusalOfClear(store)},
  };
  std::string names;
  for (const auto& [operation, answer] : answers) {
    context.checks.equal("answer of " + operation, "Store has been invalidated.", answer);
    names += (names.empty() ? "" : ", ") + operation;
  }
  context.console.line("a store that somebody still holds refuses " + names);
}

// Values in a store of the session, and in one that belongs to none.
void storeSome(DemoContext& context) {
  constexpr std::size_t pictureBytes = 4U << 10U;
  for (std::size_t i = 0; i < kSome.mostFiles; ++i) {
    const KeyValueClient::Value picture{i % context.source.files.size(), pictureBytes};
    context.values(i % 4 == 0 ? "thumbnails" : "drafts").store("picture-" + std::to_string(i), picture);
  }
  context.checkValues();
}

}  // namespace

void updateApplication(DemoContext& context) {
  std::vector<std::string> retired;
  for (const auto& store : context.stores()) {
    const std::string directory = context.app().expectedDirectory(*store);
    context.checks.isTrue(context.shortDirectory(*store) + " is there before", exists(directory));
    context.console.line((store->hasVersion ? "stays    " : "retires  ") + context.shortDirectory(*store));
    if (store->hasVersion) continue;
    retired.push_back(directory);
    context.expectEmpty(*store);
  }
  context.startTimed("101", context.app().user());
  context.checkTrashVanishes();
  checkGone(context, retired);
  context.checkContents();
}

void changeUser(DemoContext& context) {
  const std::vector<std::string> directories = sessionDirectories(context);
  const TreeSize left = sessionContents(context);
  expectSessionEmpty(context);
  context.startTimed(context.app().release(), "bob");
  context.checkTrashVanishes();
  checkGone(context, directories);
  context.checkContents();
  context.console.line("alice's " + formatFiles(left) + " are gone, what belongs to no session is as it was");
  fillSome(context);
}

void trashMarkedStore(DemoContext& context) {
  const std::string store = "downloads";
  context.app().host().managerOfStore(store)->trashStoreOnStartup(store);
  context.checkContents();  // nothing is deleted yet
  context.console.line(store + " marked, with " + formatFiles(context.contents[store]) + " still in it");
  context.contents[store] = {};
  context.restartTimed();
  context.checkContents();
  context.checkTrashVanishes();
}

void cleanseEverything(DemoContext& context) {
  TreeSize discarded;
  for (const auto& store : context.stores()) {
    discarded += store->isManaged ? context.clientOf(store->name).size() : context.contents[store->name];
    context.expectEmpty(*store);
  }
  {
    const ForcedCleanse forced;
    context.restartTimed();
  }
  context.console.line(formatFiles(discarded) + " discarded as the managers started");
  context.checkContents();
  context.checkTrashVanishes();
}

void emptyTrash(DemoContext& context) {
  const std::string store = "previews";
  fillSome(context);
  const std::string release = context.app().release();
  const std::string user = context.app().user();
  const std::string trash = context.app().trashDirectory();
  const std::string directory = context.app().unmanagedStore(store)->path;
  context.stop();

  // A collector that is killed right after its rename leaves just this.
  std::filesystem::create_directory(trash);
  std::filesystem::rename(directory, trash + "/0123456789abcdef");
  const std::uint64_t entries = entriesOfTree(trash);
  context.contents[store] = {};

  context.launch(release, user);
  const Stopwatch watch;
  context.app().host().trash()->emptyAllTrash();
  context.console.line(formatCount(entries, "entry", "entries") + " removed in " + formatTime(watch.elapsed()));
  context.checks.isTrue("the trash is gone", !exists(trash));
  const std::vector<JsonValue> reports = context.events.payloads("qztrash_collector");
  context.checks.equal("emptyings reported", 1, reports.size());
  if (!reports.empty()) {
    context.checks.equal("entries reported", entries, reports.back().at("file_count").get<std::uint64_t>());
  }
  context.app().openStores();
  context.checkContents();
}

void logOut(DemoContext& context) {
  const std::vector<std::string> directories = sessionDirectories(context);
  storeSome(context);
  const TreeSize left = sessionContents(context);
  const auto manager = context.app().host().managerOfStore("downloads");
  const auto drafts = context.app().keyValueStore("drafts");
  const Stopwatch watch;
  context.app().host().logOut();
  context.console.line(context.app().user() + "'s " + formatFiles(left) + " left their place in " +
                       formatTime(watch.elapsed()) + ", before anybody waited for the deletion");
  expectSessionEmpty(context);
  checkGone(context, directories);
  context.checks.isTrue("the manager is invalid", !manager->isValid());
  checkRefusals(context, *drafts, "picture-1");
  context.checks.isTrue("it hands out no stores", manager->getStore<Store>("downloads") == nullptr);
  context.values("thumbnails").fetchAll();
  context.console.line("what belongs to no session is fetched as before");
  context.checkContents();
  context.checkTrashVanishes();
}

}  // namespace velmora::mobile::xplat::cellar::tools
