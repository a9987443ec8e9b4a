#include "demo/DemoApp.h"

#include <chrono>

#include "JsonValue.h"
#include "LazyDispatcher.h"
#include "demo/ClockedQueues.h"
#include "demo/EventLog.h"
#include "demo/MediaApp.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::chrono::seconds kPatience(60);
constexpr const char* kLanguage = "en";
constexpr const char* kRegion = "US";

std::string areaDirectory(Area area) {
  switch (area) {
    case Area::Caches:
      return "caches";
    case Area::Documents:
      return "documents";
    case Area::Shared:
      return "shared";
  }
  return "";
}

host::HostOptions optionsFor(const std::string& root, const std::string& release, EventLog& events) {
  host::HostOptions options;
  options.configuration = kMediaAppConfiguration;
  options.root = root;
  options.versionTag = release;
  options.localeFirstTag = kLanguage;
  options.localeSecondTag = kRegion;
  options.analytics = events.sink();
  return options;
}

}  // namespace

std::vector<FileUtils::Info> WatchedFiles::listDirectory(const std::string& path) {
  ++listings_;
  return FileUtils::listDirectory(path);
}

void WatchedFiles::deleteFile(const std::string& path) {
  FileUtils::deleteFile(path);
  const std::lock_guard<std::mutex> lock(mutex_);
  deletions_.push_back(path);
}

std::uint64_t WatchedFiles::listings() const { return listings_; }

std::vector<std::string> WatchedFiles::deletions() const {
  const std::lock_guard<std::mutex> lock(mutex_);
  return deletions_;
}

DemoApp::DemoApp(const std::string& root, const std::string& release, const std::string& user, EventLog& events)
    : root_(root),
      release_(release),
      user_(user),
      files_(std::make_shared<WatchedFiles>()),
      queues_(std::make_shared<ClockedQueues>()) {
  host::HostOptions options = optionsFor(root, release, events);
  options.fileUtils = files_;
  options.taskQueueFactory = queues_;
  host_ = std::make_unique<host::Host>(std::move(options));
  host_->lazyWork()->willBeTriggeredExternally();  // nothing happens here but what a step asks for
}

DemoApp::~DemoApp() {
  queues_->drain(kPatience);
  host_.reset();
  queues_->shutDown();
}

std::vector<std::shared_ptr<const StoreDefinition>> DemoApp::storeDefinitions() const {
  std::vector<std::shared_ptr<const StoreDefinition>> definitions;
  const JsonValue document = JsonValue::parse(kMediaAppConfiguration);
  for (const auto& [managerName, manager] : document.items()) {
    for (const auto& [identifier, ignored] : manager.at("stores").items()) {
      definitions.push_back(host_->configuration()->getStore(identifier));
    }
  }
  return definitions;
}

void DemoApp::openStores() {
  for (const auto& store : storeDefinitions()) managerOf(*store)->getStore<Store>(store->name);
}

std::shared_ptr<StoreManager> DemoApp::managerOf(const StoreDefinition& store) {
  return host_->manager(store.managerName, user_);
}

std::shared_ptr<UnmanagedStore> DemoApp::unmanagedStore(const std::string& identifier) {
  return host_->store<UnmanagedStore>(identifier, user_);
}

std::shared_ptr<PersistentKeyValueStore> DemoApp::keyValueStore(const std::string& identifier) {
  return host_->store<PersistentKeyValueStore>(identifier, user_);
}

std::string DemoApp::expectedManagerDirectory(const StoreDefinition& store) const {
  const auto manager = host_->configuration()->getManager(store.managerName);
  const std::string name = manager->sessionScoped ? "_store_" + user_ : "_sessionlessStore";
  return root_ + "/" + areaDirectory(manager->area) + "/" + name;
}

std::string DemoApp::expectedDirectory(const StoreDefinition& store) const {
  std::string name = store.name;
  if (store.localeSensitive) name += std::string("_") + kLanguage + "_" + kRegion;
  if (!store.hasVersion) name += "_" + release_;
  return expectedManagerDirectory(store) + "/" + name + "_v" + std::to_string(store.version);
}

std::string DemoApp::trashDirectory() const { return root_ + "/trash"; }

bool DemoApp::settle() { return queues_->drain(kPatience); }

bool DemoApp::letPass(std::chrono::seconds time) {
  queues_->moveOn(time);
  return settle();
}

const WatchedFiles& DemoApp::files() const { return *files_; }

host::Host& DemoApp::host() { return *host_; }
std::string DemoApp::release() const { return release_; }
std::string DemoApp::user() const { return user_; }

}  // namespace velmora::mobile::xplat::cellar::tools
