#include "DemoContext.h"

#include <utility>

#include "Console.h"
#include "Format.h"
#include "Stopwatch.h"

namespace velmora::mobile::xplat::cellar::tools {

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

void DemoContext::restartTimed() { startTimed(app().release(), app().user()); }

void DemoContext::stop() { app_.reset(); }

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
}

void DemoContext::checkTrashVanishes() {
  checks.isTrue("work in the background ends", app().settle());
  checks.isTrue("the trash is gone", !exists(app().trashDirectory()));
}

void DemoContext::checkKeys(const std::string& store, std::size_t count) {
  app().settle();  // keys are known when the manifest has been loaded
  checks.equal("keys in " + store, count, app().keyValueStore(store)->getAllKeys().size());
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
}

}  // namespace velmora::mobile::xplat::cellar::tools
