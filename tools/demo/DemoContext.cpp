#include "demo/DemoContext.h"

#include <algorithm>
#include <utility>

#include "Console.h"
#include "Format.h"
#include "Stopwatch.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::size_t kFaultsWorthNaming = 3;

}  // namespace

bool isInline(const StoreDefinition& store) {
  const auto* const keyValue = dynamic_cast<const PKVSDefinition*>(&store);
  return keyValue != nullptr && keyValue->inlineData;
}

DemoContext::DemoContext(Console& console_, const SourceFiles& source_, const std::string& root_)
    : console(console_),
      checks(console_),
      source(source_),
      root(root_),
      events(root_ + "/analytics.jsonl"),
      log_(root_ + "/log.txt") {}

void DemoContext::launch(const std::string& release, const std::string& user) {
  stop();
  app_ = std::make_unique<DemoApp>(root, release, user, events);
}

void DemoContext::start(const std::string& release, const std::string& user) {
  launch(release, user);
  app().openStores();
}

void DemoContext::startTimed(const std::string& release, const std::string& user) {
  stop();
  const Stopwatch watch;
  start(release, user);
  console.line("release " + release + ", user " + user + ": " + formatCount(stores().size(), "store", "stores") +
               " opened in " + formatTime(watch.elapsed()));
}

void DemoContext::restartTimed() {
  restartAfter([] {});
}

void DemoContext::restartAfter(const std::function<void()>& work) {
  const std::string release = app().release();
  const std::string user = app().user();
  stop();
  work();
  startTimed(release, user);
}

void DemoContext::stop() {
  for (auto& client : clients_) client.second.close();
  app_.reset();
}

bool DemoContext::isRunning() const { return app_ != nullptr; }

DemoApp& DemoContext::app() { return *app_; }

std::vector<DemoContext::Definition> DemoContext::stores() { return app().storeDefinitions(); }

std::vector<DemoContext::Definition> DemoContext::unmanagedStores() {
  std::vector<Definition> unmanaged;
  for (const Definition& store : stores()) {
    if (!store->isManaged) unmanaged.push_back(store);
  }
  return unmanaged;
}

std::vector<DemoContext::Definition> DemoContext::managedStores() {
  std::vector<Definition> managed;
  for (const Definition& store : stores()) {
    if (store->isManaged) managed.push_back(store);
  }
  return managed;
}

DemoContext::Definition DemoContext::definition(const std::string& store) {
  return app().host().configuration()->getStore(store);
}

KeyValueClient& DemoContext::values(const std::string& store) {
  KeyValueClient& client = clientOf(store);
  if (!client.isOpen()) client.open(app().keyValueStore(store));
  return client;
}

KeyValueClient& DemoContext::clientOf(const std::string& store) {
  return clients_.try_emplace(store, source).first->second;
}

void DemoContext::expectEmpty(const StoreDefinition& store) {
  if (store.isManaged) {
    clientOf(store.name).items().clear();
  } else {
    contents[store.name] = {};
  }
}

bool DemoContext::belongsToSession(const StoreDefinition& store) {
  return app().host().configuration()->getManager(store.managerName)->sessionScoped;
}

std::string DemoContext::shortDirectory(const StoreDefinition& store) {
  return below(root, app().expectedDirectory(store));
}

std::vector<JsonValue> DemoContext::storeEvents(const std::string& type) const {
  std::vector<JsonValue> matching;
  for (JsonValue& payload : events.payloads("qzdiskstore_logging")) {
    if (payload.at("event_type") == type) matching.push_back(std::move(payload));
  }
  return matching;
}

void DemoContext::checkContents() {
  for (const Definition& store : unmanagedStores()) {
    const TreeSize seen = sizeOfTree(app().expectedDirectory(*store));
    checks.equal("files in " + store->name, contents[store->name].files, seen.files);
    checks.equal("bytes in " + store->name, contents[store->name].bytes, seen.bytes);
  }
  checkValues();
}

void DemoContext::checkValues() {
  app().settle();  // keys are known when the manifest has been loaded
  for (const Definition& store : managedStores()) checkValuesOf(*store);
}

void DemoContext::checkValuesOf(const StoreDefinition& store) {
  const std::string directory = app().expectedDirectory(store);
  if (!exists(directory)) {
    return checks.equal("values of " + store.name + ", which has gone", 0, clientOf(store.name).items().size());
  }
  KeyValueClient& client = values(store.name);
  client.finish();
  const std::vector<std::string> faults = client.takeFaults();
  checks.equal("values of " + store.name + " that came back wrong", 0, faults.size());
  for (std::size_t i = 0; i < faults.size() && i < kFaultsWorthNaming; ++i) console.bad("       " + faults[i]);

  const TreeSize held = client.size();
  const TreeSize files = sizeOfValues(directory);
  const TreeSize inFiles = isInline(store) ? TreeSize() : held;
  checks.equal("number of keys in " + store.name, client.items().size(), client.keysInStore().size());
  checks.isTrue("keys in " + store.name + " are those stored", client.keys() == client.keysInStore());
  checks.equal("value files of " + store.name, inFiles.files, files.files);
  checks.equal("bytes in value files of " + store.name, inFiles.bytes, files.bytes);
}

void DemoContext::checkTrashVanishes() {
  checks.isTrue("work in the background ends", app().settle());
  checks.isTrue("the trash is gone", !exists(app().trashDirectory()));
}

void DemoContext::checkLog() {
  const std::vector<std::string> errors = log_.takeErrors();
  checks.equal("errors in the log", 0, errors.size());
  for (const std::string& error : errors) console.bad("       " + error);
}

void DemoContext::noteSizes() {
  app().settle();
  for (const Definition& store : stores()) {
    const TreeSize size = sizeOfTree(app().expectedDirectory(*store));
    TreeSize& most = fullest[store->name];
    if (size.bytes > most.bytes || size.files > most.files) most = size;
  }
  for (auto& [store, client] : clients_) mostItems[store] = std::max(mostItems[store], client.items().size());
}

}  // namespace velmora::mobile::xplat::cellar::tools
