#include "host/Host.h"

#include <glog/logging.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <cstddef>
#include <map>
#include <set>
#include <stdexcept>
#include <utility>

#include "AnalyticsEventReporter.h"
#include "AttributeStore.h"
#include "Configuration.h"
#include "DiskSizeCalculator.h"
#include "FileUtils.h"
#include "JsonValue.h"
#include "LarderException.h"
#include "LazyDispatcher.h"
#include "StoreDirectoryNameBuilder.h"
#include "StoreManagerFactory.h"
#include "TrashCollector.h"
#include "host/DirectoryPathLocations.h"
#include "host/FileNames.h"
#include "host/RootLock.h"
#include "host/ThreadQueueFactory.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

constexpr std::array<Area, 3> kAreas = {Area::Caches, Area::Documents, Area::Shared};

// Managers of one area and scope share a directory, and each treats the stores of the other as stale.
void refuseSharedDirectories(const Configuration& configuration, const JsonValue& document) {
  std::map<std::pair<Area, bool>, std::string> owners;
  for (const auto& [name, ignored] : document.items()) {
    const auto definition = configuration.getManager(name);
    const auto [owner, isFree] = owners.emplace(std::pair(definition->area, definition->sessionScoped), name);
    if (isFree) continue;
    throw ConfigurationException("Managers '" + owner->second + "' and '" + name +
                                 "' would share a directory, give them different areas or session scopes.");
  }
}

std::shared_ptr<const Configuration> readConfiguration(const std::string& json) {
  auto configuration = std::make_shared<const Configuration>(json);
  refuseSharedDirectories(*configuration, JsonValue::parse(json));
  return configuration;
}

std::unique_ptr<const RootLock> lockRoot(const HostOptions& options, FileUtils& fileUtils) {
  if (options.root.empty()) throw std::invalid_argument("A host needs a root directory.");
  if (!options.lockRoot) return nullptr;
  fileUtils.createDirectory(options.root, true);
  return std::make_unique<const RootLock>(options.root);
}

std::string nameOfSession(const std::string& sessionKey) {
  return sessionKey.empty() ? sessionKey : encodeFileName(sessionKey);
}

std::shared_ptr<AnalyticsEventReporter> reporterFor(std::unique_ptr<XAnalytics> sink) {
  if (sink == nullptr) return nullptr;
  return std::make_shared<AnalyticsEventReporter>(std::move(sink));
}

void refuseOnQueueThread(const std::string& operation) {
  ThreadQueueFactory::refuseOnQueueThread(operation, "Use a thread of your own instead.");
}

HostOptions plainOptions(const std::string& configuration, const std::string& root) {
  HostOptions options;
  options.configuration = configuration;
  options.root = root;
  return options;
}

}  // namespace

// A request in progress: the managers of its scope are not ended during it. Refused while they are being ended: if a
// callback on a store's queue waited here, it would deadlock with the end of that store.
class Host::Request {
 public:
  // Throws for a name that the configuration does not have.
  Request(Host& host, const std::string& managerName)
      : definition(host.configuration_->getManager(managerName)),
        host_(host),
        scope_(definition->sessionScoped ? host.sessionScoped_ : host.sessionless_) {
    const std::lock_guard<std::mutex> lock(host_.mutex_);
    if (scope_.isEnding) throw InvalidatedException("The managers are being invalidated.");
    ++scope_.requests;
  }
  ~Request() {
    const std::lock_guard<std::mutex> lock(host_.mutex_);
    --scope_.requests;
    host_.changed_.notify_all();
  }
  Request(const Request&) = delete;
  Request& operator=(const Request&) = delete;

  Slot& slot() const {
    const std::lock_guard<std::mutex> lock(host_.mutex_);
    return scope_.managers[definition->name];
  }

  const std::shared_ptr<const StoreManagerDefinition> definition;

 private:
  const IncidentDeferral deferral_;  // a handler may make requests of its own
  Host& host_;
  Scope& scope_;
};

// The time in which a scope refuses requests. One at a time; begins when the requests in progress have finished.
class Host::Ending {
 public:
  Ending(Host& host, Scope& scope) : host_(host), scope_(scope) {
    std::unique_lock<std::mutex> lock(host_.mutex_);
    host_.changed_.wait(lock, [this] { return !scope_.isEnding; });
    scope_.isEnding = true;
    host_.changed_.wait(lock, [this] { return scope_.requests == 0; });
  }
  ~Ending() {
    const std::lock_guard<std::mutex> lock(host_.mutex_);
    scope_.isEnding = false;
    host_.changed_.notify_all();
  }
  Ending(const Ending&) = delete;
  Ending& operator=(const Ending&) = delete;

 private:
  Host& host_;
  Scope& scope_;
};

// The time in which a session that is not open is discarded and cannot be opened. One at a time.
class Host::Discarding {
 public:
  Discarding(Host& host, const std::string& tag) : host_(host) {
    std::unique_lock<std::mutex> lock(host_.mutex_);
    host_.changed_.wait(lock, [this] { return !host_.discardedTag_; });
    isOpen_ = host_.openSession_ && host_.openSession_->tag == tag;
    if (!isOpen_) host_.discardedTag_ = tag;
  }
  ~Discarding() {
    if (isOpen_) return;
    const std::lock_guard<std::mutex> lock(host_.mutex_);
    host_.discardedTag_.reset();
    host_.changed_.notify_all();
  }
  Discarding(const Discarding&) = delete;
  Discarding& operator=(const Discarding&) = delete;

  // Then nothing has begun.
  bool isOpen() const { return isOpen_; }

 private:
  Host& host_;
  bool isOpen_ = false;
};

Host::Host(HostOptions options)
    : configuration_(readConfiguration(options.configuration)),
      fileUtils_(options.fileUtils ? options.fileUtils : std::make_shared<FileUtils>()),
      rootLock_(lockRoot(options, *fileUtils_)),
      locations_(std::make_shared<DirectoryPathLocations>(options.root)),
      nameBuilders_(std::make_shared<StoreDirectoryNameBuilderFactory>(options.versionTag, options.localeSecondTag,
                                                                       options.localeFirstTag)),
      tagsTellKeys_(!options.sessionTagMapper),
      sessionTagMapper_(options.sessionTagMapper ? options.sessionTagMapper : nameOfSession),
      runMaintenance_(options.runMaintenance),
      shutDownPatience_(options.shutDownPatience),
      analytics_(reporterFor(std::move(options.analytics))),
      threads_(options.taskQueueFactory ? nullptr : std::make_shared<ThreadQueueFactory>()),
      taskQueueFactory_(threads_ ? threads_ : options.taskQueueFactory),
      trash_(std::make_shared<TrashCollector>(fileUtils_->combinePath(options.root, "trash"), fileUtils_, analytics_,
                                              taskQueueFactory_)),
      attributes_(std::make_shared<AttributeStore>(fileUtils_)),
      sizes_(std::make_shared<DiskSizeCalculator>(fileUtils_, attributes_, analytics_)),
      lazyWork_(LazyDispatcher::createLazyDispatcher(taskQueueFactory_, options.lazyDelaySeconds)),
      measuringQueue_(taskQueueFactory_->createWorkQueue()),
      incidentGate_(gateFor(std::move(options.onIncident))),
      incidents_(reporterThrough(incidentGate_, *taskQueueFactory_)) {
  trash_->setIncidents(incidents_);
  sizes_->exclude(AttributeStore::fileName);
  sizes_->setAnalytics(analytics_ != nullptr);
}

Host::Host(const std::string& configuration, const std::string& root) : Host(plainOptions(configuration, root)) {}

Host::~Host() {
  lazyWork_->willBeTriggeredExternally();
  const bool haveThreadsEnded = endThreads();  // if not, the patience is used up
  closeIncidentGate(haveThreadsEnded ? shutDownPatience_ : std::chrono::seconds(0));
}

// False when they were left behind.
bool Host::endThreads() {
  if (threads_ == nullptr) return true;
  threads_->refuseNewWork();
  if (threads_->drain(shutDownPatience_)) {
    threads_->shutDown();
    return true;
  }
  LOG(ERROR) << "Host destroyed with work pending; its threads were detached.";
  threads_->abandon();
  return false;
}

std::shared_ptr<StoreManager> Host::manager(const std::string& name, const std::optional<std::string>& sessionKey) {
  return managerIn(Request(*this, name), sessionKey);
}

std::shared_ptr<StoreManager> Host::managerOfStore(const std::string& storeIdentifier,
                                                   const std::optional<std::string>& sessionKey) {
  return manager(configuration_->getStore(storeIdentifier)->managerName, sessionKey);
}

std::shared_ptr<Store> Host::getStore(const std::string& identifier, const std::optional<std::string>& sessionKey) {
  const Request request(*this, configuration_->getStore(identifier)->managerName);
  auto store = managerIn(request, sessionKey)->getStoreImpl(identifier, PruneStrategyIdentifier::Null);
  if (store == nullptr) throw InvalidatedException("The manager of store '" + identifier + "' has been invalidated.");
  return store;
}

std::shared_ptr<StoreManager> Host::managerIn(const Request& request, const std::optional<std::string>& sessionKey) {
  const std::string session = request.definition->sessionScoped ? openSession(sessionKey) : "";
  Slot& slot = request.slot();
  std::unique_lock<std::mutex> lock(slot.mutex);
  if (slot.manager != nullptr) return slot.manager;
  auto manager = build(*request.definition, session);
  slot.manager = manager;
  lock.unlock();
  // The manager has only registered the directories of its unmanaged stores; the host has to have them measured.
  lazyWork_->addTask([sizes = sizes_] { sizes->startDiskSizeCalculation(); }, measuringQueue_);
  return manager;
}

// With a new factory each time: a factory that failed to build a manager never tries again.
std::shared_ptr<StoreManager> Host::build(const StoreManagerDefinition& definition, const std::string& sessionKey) {
  StoreManagerFactory factory(definition.sessionScoped, analytics_, attributes_, configuration_, sizes_, fileUtils_,
                              lazyWork_, locations_, nameBuilders_, taskQueueFactory_, trash_, sessionTagMapper_);
  factory.setIncidents(incidents_);
  auto manager = factory.managerForIdentifier(definition.name, sessionKey, runMaintenance_);
  manager->retryFailedCreations();
  return manager;
}

std::string Host::openSession(const std::optional<std::string>& sessionKey) {
  std::unique_lock<std::mutex> lock(mutex_);
  if (!openSession_) {
    SessionName session{sessionKey.value_or(""), ""};
    lock.unlock();
    session.tag =
        sessionTagMapper_(session.key);  // throws for a key that cannot name a directory: no session is opened
    lock.lock();
    if (discardedTag_ == session.tag) throw InvalidatedException("The session is being logged out.");
    if (!openSession_) openSession_ = std::move(session);
    hasOpenedSession_ = true;
  }
  if (sessionKey && *sessionKey != openSession_->key) {
    throw std::logic_error("Another session is open, log out before you ask for a new one.");
  }
  return openSession_->key;
}

void Host::logOut() {
  refuseOnQueueThread("Host::logOut");
  const auto hasOpenedSession = [this] {
    const std::lock_guard<std::mutex> lock(mutex_);
    return hasOpenedSession_;
  };
  if (endOpenSession(std::nullopt) || hasOpenedSession()) return;
  const std::size_t stored = sessions().size();
  if (stored == 0 || hasOpenedSession()) return;  // one that is opened meanwhile has data on disk, too
  throw std::logic_error("No session has been opened yet. Sessions with data on disk: " + std::to_string(stored) +
                         ". Name the one to end, as in logOut(sessionKey).");
}

bool Host::logOut(const std::string& sessionKey) { return endSession({sessionKey, sessionTagMapper_(sessionKey)}); }

bool Host::logOut(const StoredSession& session) { return endSession({session.key.value_or(""), session.tag}); }

bool Host::endSession(const SessionName& session) {
  refuseOnQueueThread("Host::logOut");
  while (true) {
    const Discarding discarding(*this, session.tag);
    if (!discarding.isOpen()) return discard(session);
    if (endOpenSession(session.tag)) return true;  // false if another thread has just ended it
  }
}

void Host::invalidate() {
  refuseOnQueueThread("Host::invalidate");
  endOpenSession(std::nullopt);
  const Ending ending(*this, sessionless_);
  invalidateAll(sessionless_);
}

// False when no session is open, or not the one of that tag.
bool Host::endOpenSession(const std::optional<std::string>& tag) {
  const Ending ending(*this, sessionScoped_);
  std::optional<SessionName> session;
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    session = openSession_;
  }
  if (!session || (tag && *tag != session->tag)) return false;
  invalidateAll(sessionScoped_);
  {
    const std::lock_guard<std::mutex> lock(mutex_);
    openSession_.reset();
  }
  discard(*session);
  return true;
}

// Called while the scope is ending, so that its managers are not used. If one throws, the next attempt continues there.
void Host::invalidateAll(Scope& scope) {
  for (auto& [name, slot] : scope.managers) {
    if (slot.manager != nullptr) slot.manager->invalidate();
    slot.manager = nullptr;
  }
}

// Whether there was anything. A failure in one area does not prevent the other areas from being discarded.
bool Host::discard(const SessionName& session) {
  const std::string name = nameBuilders_->createStoreDirectoryNameBuilder(session.tag)->buildStoreManagerName();
  bool isFound = false;
  std::string remaining;
  for (const Area area : kAreas) {
    try {
      if (discardIn(locations_->pathForArea(area, session.key), name)) isFound = true;
    } catch (const FileUtilsIoException& error) {
      remaining += (remaining.empty() ? "" : "; ") + std::string(error.description());
    }
  }
  if (!remaining.empty()) throw FileUtilsIoException(0, "Data of the session remains: " + remaining);
  return isFound;
}

// Whether there was anything. Checks again afterwards: a store that is being created in the background may have created
// its directory again.
bool Host::discardIn(const std::string& area, const std::string& name) {
  const std::string path = fileUtils_->combinePath(area, name);
  int attempts = 0;
  for (; holds(area, name); ++attempts) {
    if (attempts == 2) throw FileUtilsIoException(0, "could not move \"" + path + "\" to the trash");
    trash_->collectPath(path);
  }
  return attempts > 0;
}

// Listing reports an area that cannot be read, but not on every file system which entries are directories.
bool Host::holds(const std::string& area, const std::string& name) const {
  const auto names = directoriesIn(area);
  return std::find(names.begin(), names.end(), name) != names.end() ||
         fileUtils_->pathExists(fileUtils_->combinePath(area, name));
}

std::vector<StoredSession> Host::sessions() const {
  const auto names = nameBuilders_->createStoreDirectoryNameBuilder("");
  const std::size_t prefix = names->buildStoreManagerName().size();
  std::set<std::string> tags;
  for (const Area area : kAreas) {
    const auto directories = directoriesIn(locations_->pathForArea(area, ""));
    for (const std::string& name : names->filterStoreManagerNames({}, directories)) tags.insert(name.substr(prefix));
  }
  std::vector<StoredSession> sessions;
  sessions.reserve(tags.size());
  for (const std::string& tag : tags) sessions.push_back({tag, keyOf(tag)});
  return sessions;
}

std::optional<std::string> Host::keyOf(const std::string& tag) const {
  if (!tagsTellKeys_) return std::nullopt;
  if (tag.empty()) return tag;
  try {
    std::string key = decodeFileName(tag);
    if (nameOfSession(key) == tag) return key;
  } catch (const std::invalid_argument&) {
    // Named by another mapper.
  }
  return std::nullopt;
}

// The names of its directories and links (which may point to directories). None if the area does not exist yet.
std::vector<std::string> Host::directoriesIn(const std::string& area) const {
  std::vector<std::string> names;
  try {
    for (const FileUtils::Info& entry : fileUtils_->listDirectory(area)) {
      if (entry.type != FileUtils::Type::File) names.push_back(fileUtils_->basename(entry.path));
    }
  } catch (const FileUtilsIoException& error) {
    if (error.code() != ENOENT) {
      throw FileUtilsIoException(error.code(), "could not read \"" + area + "\": " + error.description());
    }
  }
  return names;
}

}  // namespace velmora::mobile::xplat::cellar::host
