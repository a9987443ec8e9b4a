#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include <cellar/Export.h>
#include <cellar/StoreManager.h>
#include <cellar/XAnalytics.h>
#include <cellar/executor/TaskQueueFactory.h>
#include <cellar/session/Invalidatable.h>

namespace velmora::mobile::xplat::cellar {

class AnalyticsEventReporter;
class AttributeStore;
class Configuration;
class DiskSizeCalculator;
class FileUtils;
class LazyDispatcher;
class StoreDirectoryNameBuilderFactory;
class TrashCollector;
struct PathLocations;
struct StoreManagerDefinition;

namespace host {

class RootLock;
class ThreadQueueFactory;

// What a host is built from. The first two are required.
struct HostOptions {
  std::string configuration;  // the JSON document of managers and stores
  std::string root;           // the directory that everything is kept in; created when it is missing

  std::string versionTag;      // part of the names of stores without a version of their own: changing it retires them
  std::string localeFirstTag;  // parts of the names of locale-sensitive stores, "en" and "US" say
  std::string localeSecondTag;

  // Makes the name of a session's directories out of its key. Empty: `encodeFileName` of the key, which throws
  // `std::length_error` for a long one. A key that is a secret or longer than some 80 bytes wants a mapper of yours.
  std::function<std::string(const std::string& sessionKey)> sessionTagMapper;

  std::unique_ptr<XAnalytics> analytics;  // null: nothing is reported

  // Until stores that nobody has asked for are created, and directories measured, in the background.
  long lazyDelaySeconds = 10;
  bool runMaintenance = true;  // whether managers clean up what is stale and prune what is over its limit
  std::chrono::seconds shutDownPatience{30};  // how long the destructor waits for work that it has accepted

  std::shared_ptr<FileUtils> fileUtils;                // null: the real file system
  std::shared_ptr<TaskQueueFactory> taskQueueFactory;  // null: threads of the host's own

  // Whether the host keeps its root to itself for as long as it lives, by a `RootLock`. Without the lock it is up to
  // you that no other host uses the root meanwhile, in this process or another: they would lose each other's values.
  bool lockRoot = true;
};

// A session of which the disk holds data.
struct StoredSession {
  std::string tag;  // what its directories are named after

  // Absent where the tag does not tell: with a mapper of yours, or for a directory that this host has not named.
  std::optional<std::string> key;
};

// Everything that an application needs to use the library, built in one go:
//
//   Host host(configurationText, "/data/app/storage");
//   auto thumbs = host.store<DiskCache>("thumbs");
//   await(thumbs->store("cat", bytes));
//   auto letters = host.store<PersistentKeyValueStore>("letters", "session-42");
//   host.logOut();                                                     // the session that is open
//   for (const auto& session : host.sessions()) host.logOut(session);  // and those of earlier runs
//
// Under the root: "caches", "documents", "shared" (the areas), "trash" and the lock file "_cellar_lock". One host at a
// time may use a root, in all processes together. Any thread may call.
//
// Sessions: one at a time. The first request that gives a session key opens that session, a request without one for a
// session-scoped manager opens the session "", and requests without a key mean the open one. Asking for another session
// throws until `logOut`, because a manager keeps its first session and its maintenance removes all others. Managers
// without session scope ignore keys. After a restart no session is open, and the data of the last one is still there:
// `sessions` lists it, and `logOut(sessionKey)` discards it.
//
// Destroying the host loses no data. It ends promptly, however busy other threads are: what they ask for from then on
// fails at once with a broken promise in its future, work that waits for the lazy delay is dropped, and what was
// accepted before is finished, from queue to queue. Then the host's own threads end, and another host may use the root.
// What is not finished after the patience (a task that is stuck, callbacks that keep starting new work) is left to the
// threads, which are left behind, with one error line: a write that they do not come to fails, and the value before it
// stays. Managers and stores that are still held do no work from then on: their futures are broken promises.
//
// Queues that came with the options are not waited for: have them done before another host uses the root. The
// destructor may run on one of the host's own queues, and then waits for nothing.
class CELLAR_EXPORT Host : public session::Invalidatable {
 public:
  // Throws what `Configuration` throws; `ConfigurationException` when two managers of one area are both session scoped
  // or both not (they would have one directory and clean up each other's stores); `std::invalid_argument` when the root
  // is empty; `FileUtilsIoException` when the root cannot be created or locked, at once and with the owner's process id
  // when another host uses it (code `EWOULDBLOCK`). Creates the root and its lock file; all other directories are
  // created with the managers. Without `lockRoot` it touches no disk.
  explicit Host(HostOptions options);
  Host(const std::string& configuration, const std::string& root);
  ~Host() override;
  Host(const Host&) = delete;
  Host& operator=(const Host&) = delete;

  // The manager of that name, built on first request; never empty. Throws `ConfigurationException` when there is none,
  // `std::logic_error` when another session is open, `InvalidatedException` while its scope is being ended, what the
  // mapper throws for a session's key, and what building the manager throws. A manager that could not be built is built
  // by the next request, and nothing is discarded for it. Its stores, too, are created again after a failure
  // (`StoreManager::retryFailedCreations`).
  std::shared_ptr<StoreManager> manager(const std::string& name,
                                        const std::optional<std::string>& sessionKey = std::nullopt);

  // The manager that owns the store. The same.
  std::shared_ptr<StoreManager> managerOfStore(const std::string& storeIdentifier,
                                               const std::optional<std::string>& sessionKey = std::nullopt);

  // The store of that identifier, of whichever manager, pruned in the order that its definition names; never empty.
  // Throws as `manager`, what creating the store throws, `std::logic_error` when it is not a `StoreType`, and
  // `InvalidatedException` when you have invalidated its manager yourself. A store that could not be created, here or
  // in the background, is created by the next request: nobody waits for it without end.
  template <class StoreType>
  std::shared_ptr<StoreType> store(const std::string& storeIdentifier,
                                   const std::optional<std::string>& sessionKey = std::nullopt) {
    return detail::storeAs<StoreType>(storeIdentifier, getStore(storeIdentifier, sessionKey));
  }

  // Ends the open session: its managers and stores become invalid and its directories go to the trash, in all areas,
  // those of managers that nobody has asked for included. The next request may open another session. Stores finish what
  // they are writing meanwhile, and requests for session-scoped managers are refused: must not be called on one of the
  // stores' queues, nor in a callback that runs there. On the host kit's own threads it throws `std::logic_error`.
  //
  // Throws `FileUtilsIoException` that names what could not be discarded; the session has ended then all the same, and
  // `logOut(sessionKey)` tries again. Not an error: the session that was open has ended already. But when none has been
  // opened since the host was created, and there is data of sessions, it throws `std::logic_error`: it cannot know
  // whose to discard.
  void logOut();

  // Ends that session, as `logOut()` if it is open. If not, as after a restart, its directories in all areas go to the
  // trash, which an open session does not notice; requests that would open it meanwhile throw `InvalidatedException`.
  // True when the session was open or there was data of it; that there was none is not an error. Throws as `logOut()`,
  // and what the mapper throws for the key.
  bool logOut(const std::string& sessionKey);
  bool logOut(const StoredSession& session);

  // The sessions of which there are directories in some area, by tag; the open one is among them once it has been used.
  // Throws `FileUtilsIoException` when an area cannot be read.
  std::vector<StoredSession> sessions() const;

  // Ends the open session, if there is one, and discards the data of the other managers that were asked for, too. Waits
  // and throws as `logOut`.
  void invalidate() override;

  // The services behind it, for those who build more on them. None is null but `analytics`.
  const std::shared_ptr<const Configuration>& configuration() const { return configuration_; }
  const std::shared_ptr<FileUtils>& files() const { return fileUtils_; }
  const std::shared_ptr<AnalyticsEventReporter>& analytics() const { return analytics_; }
  const std::shared_ptr<TaskQueueFactory>& queues() const { return taskQueueFactory_; }
  const std::shared_ptr<TrashCollector>& trash() const { return trash_; }
  const std::shared_ptr<AttributeStore>& attributes() const { return attributes_; }
  const std::shared_ptr<DiskSizeCalculator>& sizes() const { return sizes_; }
  const std::shared_ptr<LazyDispatcher>& lazyWork() const { return lazyWork_; }

 private:
  // One manager, null until it has been built.
  struct Slot {
    std::mutex mutex;  // guards the manager, and is held while it is built
    std::shared_ptr<StoreManager> manager;
  };
  // The managers of one scope by name, and who is asking for them. All is guarded by the mutex of the host.
  struct Scope {
    std::map<std::string, Slot> managers{};  // grows only
    std::size_t requests = 0;                // under way
    bool isEnding = false;                   // and lets no further request in
  };
  struct SessionName {
    std::string key;
    std::string tag;
  };
  class Request;
  class Ending;
  class Discarding;

  std::shared_ptr<Store> getStore(const std::string& identifier, const std::optional<std::string>& sessionKey);
  std::shared_ptr<StoreManager> managerIn(const Request& request, const std::optional<std::string>& sessionKey);
  std::shared_ptr<StoreManager> build(const StoreManagerDefinition& definition, const std::string& sessionKey);
  std::string openSession(const std::optional<std::string>& sessionKey);
  static void invalidateAll(Scope& scope);
  bool endSession(const SessionName& session);
  bool endOpenSession(const std::optional<std::string>& tag);
  bool discard(const SessionName& session);
  bool discardIn(const std::string& area, const std::string& name);
  bool holds(const std::string& area, const std::string& name) const;
  std::vector<std::string> directoriesIn(const std::string& area) const;
  std::optional<std::string> keyOf(const std::string& tag) const;

  const std::shared_ptr<const Configuration> configuration_;
  const std::shared_ptr<FileUtils> fileUtils_;
  const std::unique_ptr<const RootLock> rootLock_;  // null when it is not wanted; released after all that follows
  const std::shared_ptr<PathLocations> locations_;
  const std::shared_ptr<StoreDirectoryNameBuilderFactory> nameBuilders_;
  const bool tagsTellKeys_;
  const std::function<std::string(const std::string&)> sessionTagMapper_;
  const bool runMaintenance_;
  const std::chrono::seconds shutDownPatience_;
  const std::shared_ptr<AnalyticsEventReporter> analytics_;
  const std::shared_ptr<ThreadQueueFactory> threads_;  // null when the queues are somebody else's
  const std::shared_ptr<TaskQueueFactory> taskQueueFactory_;
  const std::shared_ptr<TrashCollector> trash_;
  const std::shared_ptr<AttributeStore> attributes_;
  const std::shared_ptr<DiskSizeCalculator> sizes_;
  const std::shared_ptr<LazyDispatcher> lazyWork_;
  const std::shared_ptr<AsyncExecutor> measuringQueue_;

  std::mutex mutex_;                 // guards all below, never held while anything is called
  std::condition_variable changed_;  // a scope's requests, its end, or that of a discarding
  Scope sessionScoped_;
  Scope sessionless_;
  std::optional<SessionName> openSession_;
  bool hasOpenedSession_ = false;            // at any time
  std::optional<std::string> discardedTag_;  // of a session that is not open, while it is discarded
};

}  // namespace host
}  // namespace velmora::mobile::xplat::cellar
