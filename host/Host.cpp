#include "host/Host.h"

#include <glog/logging.h>

#include <algorithm>
#include <cstddef>
#include <exception>
#include <mutex>
#include <stdexcept>
#include <system_error>
#include <thread>
#include <utility>

#include "AnalyticsEventReporter.h"
#include "AttributeStore.h"
#include "Configuration.h"
#include "DiskSizeCalculator.h"
#include "FileUtils.h"
#include "LarderException.h"
#include "LazyDispatcher.h"
#include "StoreDirectoryNameBuilder.h"
#include "StoreManagerFactory.h"
#include "TrashCollector.h"
#include "host/Errors.h"
#include "host/FileNames.h"
#include "host/RootLock.h"
#include "host/ThreadQueueFactory.h"
#include "host/configuration/Outline.h"
#include "host/configuration/Reading.h"
#include "host/errors/Texts.h"
#include "host/figures/ManagerFigures.h"
#include "host/figures/MeasuredSizes.h"
#include "host/limits/PromptPruning.h"
#include "host/limits/UnmanagedMeasuring.h"
#include "host/sessions/ManagerScopes.h"
#include "host/sessions/SessionData.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

// Longer ones do not fit into the nanoseconds that clocks count.
constexpr std::chrono::hours kLongestPatience(24 * 365 * 100);
constexpr long kLongestDelay = 2'000'000'000;  // seconds

std::vector<std::string> namesOfManagers(const std::string& configuration) {
  std::vector<std::string> names;
  for (const Outline& manager : outlineOf(configuration).members) names.push_back(manager.name);
  std::sort(names.begin(), names.end());
  return names;
}

// A manager or store could not be built.
class BuildError : public StoreError {
 public:
  BuildError(const std::string& culprit, const std::string& store, const std::string& path)
      : StoreError(joined({culprit, ", ", path, ": ", currentText()}), store, "", path) {}
};

// Throws the exception that is being handled so that it names what could not be built. File errors stay what they are,
// and so does what says that a request was wrong or that something has been ended.
[[noreturn]] void throwNamed(const std::string& culprit, const std::string& store, const std::string& path) {
  try {
    throw;
  } catch (const FileUtilsIoException& error) {
    std::throw_with_nested(
        FileUtilsIoException(error.code(), joined({culprit, ", ", path, ": ", error.description()})));
  } catch (const InvalidatedException&) {
    throw;
  } catch (const ConfigurationException&) {
    throw;
  } catch (const std::logic_error&) {
    throw;
  } catch (...) {
    throw BuildError(culprit, store, path);
  }
}

std::shared_ptr<const RootLock> lockRoot(const HostOptions& options, FileUtils& fileUtils) {
  if (options.root.empty()) throw std::invalid_argument("A host needs a root directory.");
  if (!options.lockRoot) return nullptr;
  fileUtils.createDirectory(options.root, true);
  return std::make_shared<const RootLock>(options.root);
}

std::string nameOfSession(const std::string& sessionKey) {
  if (sessionKey.empty()) return sessionKey;
  try {
    return encodeFileName(sessionKey);
  } catch (const std::length_error&) {  // its text has the key, which may be secret
    throw std::length_error("A session's key of " + std::to_string(sessionKey.size()) +
                            " bytes would be too long for a file name. Set a session tag mapper.");
  }
}

std::shared_ptr<AnalyticsEventReporter> reporterFor(std::unique_ptr<XAnalytics> sink) {
  if (sink == nullptr) return nullptr;
  return std::make_shared<AnalyticsEventReporter>(std::move(sink));
}

std::shared_ptr<AsyncExecutor> pruningQueue(const HostOptions& options, TaskQueueFactory& queues) {
  const bool prunesPromptly = options.prune == Prune::Promptly && options.runMaintenance;
  return prunesPromptly ? queues.createWorkQueue() : nullptr;
}

// False if that takes longer: then the threads are left behind.
bool finish(ThreadQueueFactory& threads, std::chrono::seconds patience) {
  if (threads.drain(patience)) {
    threads.shutDown();
    return true;
  }
  LOG(ERROR) << "Host destroyed with work pending; its threads were detached.";
  threads.abandon();
  return false;
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

Host::Host(HostOptions options)
    : configuration_(readConfiguration(options.configuration)),
      managerNames_(namesOfManagers(options.configuration)),
      fileUtils_(options.fileUtils ? options.fileUtils : std::make_shared<FileUtils>()),
      rootLock_(lockRoot(options, *fileUtils_)),
      nameBuilders_(std::make_shared<StoreDirectoryNameBuilderFactory>(options.versionTag, options.localeSecondTag,
                                                                       options.localeFirstTag)),
      tagsTellKeys_(!options.sessionTagMapper),
      sessionTagMapper_(options.sessionTagMapper ? options.sessionTagMapper : nameOfSession),
      runMaintenance_(options.runMaintenance),
      shutDownPatience_(
          std::clamp<std::chrono::seconds>(options.shutDownPatience, std::chrono::seconds::zero(), kLongestPatience)),
      analytics_(reporterFor(std::move(options.analytics))),
      threads_(options.taskQueueFactory ? nullptr : std::make_shared<ThreadQueueFactory>()),
      taskQueueFactory_(threads_ ? threads_ : options.taskQueueFactory),
      trashPath_(fileUtils_->combinePath(options.root, "trash")),
      trash_(std::make_shared<TrashCollector>(trashPath_, fileUtils_, analytics_, taskQueueFactory_)),
      attributes_(std::make_shared<AttributeStore>(fileUtils_)),
      measuredSizes_(std::make_shared<MeasuredSizes>(fileUtils_, attributes_, analytics_)),
      sizes_(measuredSizes_),
      lazyWork_(
          LazyDispatcher::createLazyDispatcher(taskQueueFactory_, std::min(options.lazyDelaySeconds, kLongestDelay))),
      measuringQueue_(taskQueueFactory_->createWorkQueue()),
      incidentGate_(gateFor(std::move(options.onIncident))),
      incidents_(reporterThrough(incidentGate_, *taskQueueFactory_)),
      pruningQueue_(pruningQueue(options, *taskQueueFactory_)),
      pruneDelay_(options.pruneDelay),
      unmanaged_(measuringEvery(options.measureUnmanagedEvery)),
      sessionData_(std::make_unique<SessionData>(options.root, options.accounts == Accounts::Kept, fileUtils_, trash_,
                                                 nameBuilders_)),
      scopes_(std::make_unique<ManagerScopes>(options.accounts == Accounts::Kept, sessionTagMapper_)) {
  trash_->setIncidents(incidents_);
  sizes_->exclude(AttributeStore::fileName);
  sizes_->setAnalytics(analytics_ != nullptr);
}

Host::Host(const std::string& configuration, const std::string& root) : Host(plainOptions(configuration, root)) {}

// Null: never.
std::shared_ptr<UnmanagedMeasuring> Host::measuringEvery(std::chrono::seconds interval) const {
  if (interval <= std::chrono::seconds(0)) return nullptr;
  UnmanagedMeasuring::Services services{measuringQueue_, fileUtils_, attributes_, sizes_, incidents_};
  services.onMeasured = [sizes = measuredSizes_](const std::string& path, const DiskSizeCalculator::Stats& stats) {
    sizes->noteMeasured(path, stats);
  };
  return std::make_shared<UnmanagedMeasuring>(interval, std::move(services));
}

Host::~Host() {
  lazyWork_->willBeTriggeredExternally();
  const bool isPatient = endThreads();
  closeIncidentGate(isPatient ? shutDownPatience_ : std::chrono::seconds(0));
}

// False when that has used the patience up.
bool Host::endThreads() {
  if (threads_ == nullptr) return true;
  threads_->refuseNewWork();
  if (!threads_->isOwnThread()) return finish(*threads_, shutDownPatience_);
  // This thread has to run what would be waited for, so another one waits, and keeps the root until then.
  if (rootLock_ != nullptr) rootLock_->announceEnd();
  try {
    std::thread([threads = threads_, root = rootLock_, patience = shutDownPatience_] {
      finish(*threads, patience);
    }).detach();
  } catch (const std::system_error& error) {
    LOG(ERROR) << "Host destroyed on a thread of its own, and no other one can wait for its work: " << error.what();
    threads_->abandon();
  }
  return true;
}

std::shared_ptr<StoreManager> Host::manager(const std::string& name, const std::optional<std::string>& sessionKey) {
  const auto definition = configuration_->getManager(name);
  const ManagerScopes::Request request =
      definition->sessionScoped ? ManagerScopes::Request(*scopes_, sessionKey) : ManagerScopes::Request(*scopes_);
  return managerIn(*definition, *request.scope(), request.slot(name));
}

std::shared_ptr<StoreManager> Host::managerOfStore(const std::string& storeIdentifier,
                                                   const std::optional<std::string>& sessionKey) {
  return manager(configuration_->getStore(storeIdentifier)->managerName, sessionKey);
}

std::shared_ptr<Store> Host::getStore(const std::string& identifier, const std::optional<std::string>& sessionKey) {
  const auto definition = configuration_->getManager(configuration_->getStore(identifier)->managerName);
  const ManagerScopes::Request request =
      definition->sessionScoped ? ManagerScopes::Request(*scopes_, sessionKey) : ManagerScopes::Request(*scopes_);
  return storeIn(*definition, *request.scope(), request.slot(definition->name), identifier);
}

std::shared_ptr<StoreManager> Host::managerOf(const std::shared_ptr<ManagerScope>& session, const std::string& name) {
  const auto definition = configuration_->getManager(name);
  const ManagerScopes::Request ofSession(*scopes_, session);
  if (!definition->sessionScoped) return manager(name);
  return managerIn(*definition, *session, ofSession.slot(name));
}

std::shared_ptr<Store> Host::storeOf(const std::shared_ptr<ManagerScope>& session, const std::string& identifier) {
  const auto definition = configuration_->getManager(configuration_->getStore(identifier)->managerName);
  const ManagerScopes::Request ofSession(*scopes_, session);
  if (!definition->sessionScoped) return getStore(identifier, std::nullopt);
  return storeIn(*definition, *session, ofSession.slot(definition->name), identifier);
}

std::shared_ptr<Store> Host::storeIn(const StoreManagerDefinition& definition, ManagerScope& scope, ManagerSlot& slot,
                                     const std::string& identifier) {
  const auto manager = managerIn(definition, scope, slot);
  std::shared_ptr<Store> store;
  try {
    store = manager->getStoreImpl(identifier, PruneStrategyIdentifier::Null);
  } catch (...) {
    throwNamed(joined({"Store '", identifier, "' of manager '", definition.name, "'"}), identifier,
               sessionData_->pathOf(definition, *definition.stores.at(identifier), scope.tag));
  }
  if (store == nullptr) throw InvalidatedException("The manager of store '" + identifier + "' has been invalidated.");
  if (unmanaged_ != nullptr) unmanaged_->noteRequest(store);
  return store;
}

std::shared_ptr<StoreManager> Host::managerIn(const StoreManagerDefinition& definition, ManagerScope& scope,
                                              ManagerSlot& slot) {
  std::unique_lock<std::mutex> lock(slot.mutex);
  if (slot.manager != nullptr) return slot.manager;
  const auto figures = std::make_shared<const ManagerFigures>(definition);
  try {
    slot.manager = build(definition, scope, *figures);
  } catch (...) {
    throwNamed(joined({"Manager '", definition.name, "'"}), "", sessionData_->pathOf(definition, scope.tag));
  }
  auto manager = slot.manager;
  scopes_->setFigures(slot, figures);
  lock.unlock();
  // The manager has only registered the directories of its unmanaged stores; the host has to have them measured.
  lazyWork_->addTask([sizes = sizes_] { sizes->startDiskSizeCalculation(); }, measuringQueue_);
  return manager;
}

// With a new factory each time: a factory that failed to build a manager never tries again.
std::shared_ptr<StoreManager> Host::build(const StoreManagerDefinition& definition, ManagerScope& scope,
                                          const ManagerFigures& figures) {
  auto locations = sessionData_->sessionless();
  if (definition.sessionScoped) {
    const std::lock_guard<std::mutex> lock(scope.adoption);
    if (!scope.isAdopted) sessionData_->adopt(scope.tag);
    scope.isAdopted = true;
    locations = sessionData_->locationsOf(scope.tag);
  }
  StoreManagerFactory factory(definition.sessionScoped, figures.observe(analytics_), attributes_,
                              figures.observe(definition, analytics_, measuredSizes_), sizes_, fileUtils_, lazyWork_,
                              locations, nameBuilders_, taskQueueFactory_, trash_,
                              [&scope](const std::string&) { return scope.tag; });
  factory.setIncidents(incidents_);
  auto manager = factory.managerForIdentifier(definition.name, scope.key, runMaintenance_);
  manager->retryFailedCreations();
  if (pruningQueue_ != nullptr && definition.pruneInterval != 0) {
    PromptPruning::begin(manager, definition, pruningQueue_, pruneDelay_);
  }
  return manager;
}

Session Host::openSession(const std::string& sessionKey) {
  return {*this, ManagerScopes::Request(*scopes_, sessionKey).scope()};
}

bool Host::isOpen(const std::shared_ptr<ManagerScope>& session) const {
  const auto open = scopes_->openSessions();
  return std::find(open.begin(), open.end(), session) != open.end();
}

void Host::logOut() {
  refuseOnQueueThread("Host::logOut");
  {
    ManagerScopes::Ending ending(*scopes_, std::nullopt);
    if (ending.scope() != nullptr) {
      ending.invalidateManagers();
      sessionData_->discard(ending.scope()->tag);
      return;
    }
  }
  if (scopes_->hasOpenedSession()) return;
  const std::size_t stored = sessions().size();
  if (stored == 0 || scopes_->hasOpenedSession()) return;  // one that is opened meanwhile has data on disk, too
  throw std::logic_error("No session has been opened yet. Sessions with data on disk: " + std::to_string(stored) +
                         ". Name the one to end, as in logOut(sessionKey).");
}

bool Host::logOut(const std::string& sessionKey) {
  return logOut(StoredSession{sessionTagMapper_(sessionKey), sessionKey});
}

bool Host::logOut(const StoredSession& session) {
  refuseOnQueueThread("Host::logOut");
  ManagerScopes::Ending ending(*scopes_, session.tag);
  const bool wasOpen = ending.scope()->isOpen;
  if (wasOpen) ending.invalidateManagers();
  return sessionData_->discard(session.tag) || wasOpen;
}

bool Host::end(const std::shared_ptr<ManagerScope>& session) {
  refuseOnQueueThread("Session::end");
  ManagerScopes::Ending ending(*scopes_, session);
  if (ending.scope() == nullptr) return false;
  ending.invalidateManagers();
  sessionData_->discard(session->tag);
  return true;
}

void Host::invalidate() {
  refuseOnQueueThread("Host::invalidate");
  std::exception_ptr failure;  // the first; it keeps nothing else from being discarded
  for (const auto& session : scopes_->openSessions()) {
    try {
      end(session);
    } catch (...) {
      if (failure == nullptr) failure = std::current_exception();
    }
  }
  ManagerScopes::Ending(*scopes_).invalidateManagers();
  if (failure != nullptr) std::rethrow_exception(failure);
}

std::vector<StoredSession> Host::sessions(SessionSizes sizes) const {
  std::vector<StoredSession> sessions;
  for (const std::string& tag : sessionData_->tags()) {
    sessions.push_back({tag, keyOf(tag)});
    if (sizes == SessionSizes::Measured) sessions.back().bytes = sessionData_->bytesOf(tag);
  }
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

}  // namespace velmora::mobile::xplat::cellar::host
