#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <cellar/Export.h>
#include <cellar/Incident.h>
#include <cellar/StoreManager.h>
#include <cellar/XAnalytics.h>
#include <cellar/executor/TaskQueueFactory.h>
#include <cellar/host/Metrics.h>
#include <cellar/host/Session.h>
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
struct StoreManagerDefinition;

namespace host {

class ManagerFigures;
class ManagerScopes;
class MeasuredSizes;
class RootLock;
class SessionData;
class ThreadQueueFactory;
class UnmanagedMeasuring;
struct ManagerSlot;

// What becomes of a session's data when another session opens.
enum class Accounts {
  OneAtATime,  // one session is open at a time; maintenance of its managers removes the data of the others
  Kept,        // several may be open at the same time, and the data of each is kept until it is logged out
};

// When a manager prunes its disk caches.
enum class Prune {
  AtIntervals,  // when all its stores together exceed its own limit, at most once in each `prune_interval`
  Promptly,     // also some seconds after one of its disk caches, or all its stores together, exceed a limit by a tenth
};

// What a host is built from. `configuration` and `root` are required.
struct HostOptions {
  std::string configuration;  // the JSON document of managers and stores
  std::string root;           // the directory that contains everything; created if it is missing

  std::string versionTag;  // part of the names of stores without a version of their own: after a change they are empty
  std::string localeFirstTag;  // parts of the names of locale-sensitive stores, for example "en" and "US"
  std::string localeSecondTag;

  // Makes the name of a session's directories from its key. Empty: `encodeFileName` of the key, which throws
  // `std::length_error` for a long one. Set a mapper if keys are secret or longer than about 80 bytes.
  std::function<std::string(const std::string& sessionKey)> sessionTagMapper;

  std::unique_ptr<XAnalytics> analytics;  // null: nothing is reported

  // Seconds until unused stores are created, and directories measured, in the background. More than 2,000,000,000 (63
  // years) count as that.
  long lazyDelaySeconds = 10;
  bool runMaintenance = true;  // whether managers remove stale data and prune stores that are over their limits
  std::chrono::seconds shutDownPatience{30};  // how long the destructor waits for accepted work

  // With `Promptly` a manager prunes `pruneDelay` after a limit has been exceeded by more than a tenth, if it still is:
  // its own limit or that of a disk cache, the configured one. It then prunes each disk cache that is over its own
  // limit. So a cache has little more than 1.1 times its limit and what is written in this time. `pruneDelay` is also
  // the least time between two such prunes of a manager; less than 1 second counts as 1. No timer runs while the limits
  // are kept. A store tells its size with each write, and five minutes after it was opened.
  //
  // Only with maintenance, for managers that prune at all (`prune_interval` is not 0), and as long as the host or
  // somebody else has a handle on the manager.
  Prune prune = Prune::AtIntervals;
  std::chrono::seconds pruneDelay{3};

  // How often the host measures an unmanaged cache that has a limit while it is in use; 0: only as the library does, as
  // it is opened and not more than once in a week. One that has more than its limit is an `OverLimit` incident, once
  // until it is measured within its limit; nothing is deleted before the cache is opened the next time, then by the
  // size measured last.
  //
  // A cache is in use when `Host::store` or `Session::store` has returned it since it was last measured, and then as
  // long as somebody other than its manager holds it. Who keeps the path only does not count, nor who has it from the
  // manager. Measuring takes place on a queue of the host's, and a hundred times as long as it has taken passes before
  // the next time. The end of the host waits for a measurement that is under way.
  std::chrono::seconds measureUnmanagedEvery{0};

  std::shared_ptr<FileUtils> fileUtils;                // null: the real file system
  std::shared_ptr<TaskQueueFactory> taskQueueFactory;  // null: threads of the host's own

  // Whether the host locks its root with a `RootLock` until it is destroyed. Without the lock you must make sure that
  // no other host uses the root, in this process or another: they would lose each other's values.
  bool lockRoot = true;

  // With `Kept` each session has areas of its own under "_cellar_accounts". Data of before, in the root's areas, is
  // moved there when its session opens, and back when the host is set to `OneAtATime` again: then what remains there is
  // listed by `sessions`, and not removed by maintenance.
  Accounts accounts = Accounts::OneAtATime;

  // Called for each `Incident`: something that nobody has asked for has happened to stored data. Empty: incidents are
  // only logged. It runs on a queue of its own, one call at a time: a slow one delays further incidents and the end of
  // the host, and keeps one of the host's few threads from other work. It may use the host and its stores, except
  // `logOut`, `invalidate` and `Session::end`, which throw on the host's own threads. What it throws is one error line
  // in the log.
  //
  // No lock is held during a call. Queues of your own that run tasks at once call it on the thread that reports: of a
  // manager, and of a store that could not be created, when the request to the host is over; of a store's values, and
  // of the trash, perhaps within an operation of a store, so it must not use stores then.
  //
  // What is reported before the host is destroyed is handed over before the destructor returns, but not if the queues
  // came with the options, the patience has been used up, or the destructor runs on a thread of the host's own queues:
  // what still waits is dropped then. The destructor waits for a call that is under way for
  // `shutDownPatience` at most, not at all if that has been used up, and not for one that it runs in. No call begins
  // after it has returned.
  std::function<void(const Incident& incident)> onIncident;
};

// A session that has data on disk.
struct StoredSession {
  std::string tag;  // the name of its directories

  // Absent if it cannot be derived from the tag: with your own mapper, or for a directory that this host has not named.
  std::optional<std::string> key;

  std::optional<std::uint64_t> bytes{};  // of all its files; absent unless they were to be measured
};

// Whether `Host::sessions` adds up the sizes of all files, which takes some seconds for a million of them.
enum class SessionSizes { Skipped, Measured };

// Whether `Host::metrics` reads the trash, which takes some seconds for a million files.
enum class TrashSize { Skipped, Measured };

// Everything that an application needs to use the library, built in one call:
//
//   Host host(configurationText, "/data/app/storage");
//   auto thumbs = host.store<DiskCache>("thumbs");
//   await(thumbs->store("cat", bytes));
//   auto letters = host.store<PersistentKeyValueStore>("letters", "session-42");
//   host.logOut();                                                     // the session that is open
//   for (const auto& session : host.sessions()) host.logOut(session);  // and those of earlier runs
//
// Under the root: "caches", "documents", "shared" (the areas), "_cellar_accounts", "trash" and the lock file
// "_cellar_lock". One host at a time may use a root, in all processes together. Any thread may call.
//
// Sessions: one at a time, unless the options say otherwise. The first request with a session key opens that session;
// if the first request for a session-scoped manager has no key, it opens the session "". Later requests without a key
// mean the open session. Requests for another session throw until `logOut`, because a manager keeps its first session
// and its maintenance removes all others. Managers without session scope ignore keys. After a restart no session is
// open, and the data of the last one is still there: `sessions` lists it, and `logOut(sessionKey)` discards it.
//
// With `HostOptions::accounts = Accounts::Kept` each request with a key opens that session beside the others. A request
// without a key means the open session, or opens the session "" if none is open; it throws `std::logic_error` if there
// are several. The data of a session is kept until `logOut` or `Session::end`.
//
// Destroying the host loses no data. It ends promptly, however busy other threads are: their new requests fail at once
// with a broken promise in the future, work that waits for the lazy delay is dropped, and work that was accepted before
// is finished, from queue to queue. Then the host's own threads end, and another host may use the root. If work is not
// finished after `shutDownPatience` (a task that is stuck, callbacks that keep starting new work), the threads are
// detached and one error line is logged. They go on with what was dispatched, while another host may use the root
// already: allow for the slowest disk. A write that they do not reach fails, and its previous value remains. Managers
// and stores that are still held do no more work: their futures are broken promises.
//
// The destructor may run on one of the host's own queues, in a callback that releases the last reference. It cannot
// wait there for the queues: another thread waits for them and ends them. To a process that ends before that
// happens what happens to one that is killed. Until then the root is in use: another host waits for it in its
// constructor, and in that callback is refused.
//
// The destructor does not wait for queues that came with the options: let them finish before another host uses the
// root.
class CELLAR_EXPORT Host : public session::Invalidatable {
 public:
  // Throws what `Configuration` throws, and `ConfigurationException` when two managers of one area are both session
  // scoped or both not (they would share a directory and remove each other's stores); each of these is a
  // `ConfigurationError` of host/Errors.h as well, which tells line and column. `std::invalid_argument` when the root
  // is empty; `FileUtilsIoException` when the root cannot be created or locked, at once and with the owner's process id
  // when another host uses it (code `EWOULDBLOCK`), unless that one is just ending on a queue of its own. Creates the
  // root and its lock file; all other directories are created with the managers. Without `lockRoot` it does not access
  // the disk.
  explicit Host(HostOptions options);
  Host(const std::string& configuration, const std::string& root);
  ~Host() override;
  Host(const Host&) = delete;
  Host& operator=(const Host&) = delete;

  // The manager of that name, built on first request; never empty. Throws `ConfigurationException` when there is none,
  // `std::logic_error` when another session is open, `InvalidatedException` while its scope is being ended, what the
  // mapper throws for a session's key, and what building the manager throws. That names the manager and its directory,
  // and with it the session's tag, not its key: a `FileUtilsIoException` is one still, with the same code and the
  // original nested in it; anything else but a `std::logic_error` or one of the above becomes a `StoreError`, whose
  // store is "". If building fails, nothing is discarded, and the next request tries again. Stores whose creation
  // failed are created again, too (`StoreManager::retryFailedCreations`).
  std::shared_ptr<StoreManager> manager(const std::string& name,
                                        const std::optional<std::string>& sessionKey = std::nullopt);

  // The manager that owns the store. Same rules as `manager`.
  std::shared_ptr<StoreManager> managerOfStore(const std::string& storeIdentifier,
                                               const std::optional<std::string>& sessionKey = std::nullopt);

  // The store of that identifier, of any manager, with the prune strategy of its definition; never empty. Throws as
  // `manager`, what creating the store throws, likewise with the names of the store, its manager and its directory,
  // `std::logic_error` when it is not a `StoreType`, and `InvalidatedException` when you have invalidated its manager
  // yourself. If a store could not be created, here or in the background, the next request tries again: no caller waits
  // for it forever.
  template <class StoreType>
  std::shared_ptr<StoreType> store(const std::string& storeIdentifier,
                                   const std::optional<std::string>& sessionKey = std::nullopt) {
    return cellar::detail::storeAs<StoreType>(storeIdentifier, getStore(storeIdentifier, sessionKey));
  }

  // The session of that key, which is opened if it is not. Throws as a request for one of its managers does.
  [[nodiscard]] Session openSession(const std::string& sessionKey);

  // Ends the open session: its managers and stores become invalid and its directories are moved to the trash, in all
  // areas, including those of managers that were never requested. The next request may open another session. During
  // the call, stores finish what they are writing, and requests for session-scoped managers are refused: must not be
  // called on one of the stores' queues, nor in a callback that runs there. On the host kit's own threads it throws
  // `std::logic_error`.
  //
  // Throws `FileUtilsIoException` that names what could not be discarded; the session has ended nevertheless, and
  // `logOut(sessionKey)` tries again. Not an error: the open session was ended already. If no session has been opened
  // since the host was created, but there is data of sessions, it throws `std::logic_error`: it cannot know which one
  // to discard. So it does if several sessions are open.
  void logOut();

  // Ends that session: as `logOut()` if it is open. If not, for example after a restart, its directories in all areas
  // are moved to the trash, which does not affect an open session; requests that would open it during the call throw
  // `InvalidatedException`. True if the session was open or had data; no data is not an error. Throws as `logOut()`,
  // and what the mapper throws for the key.
  bool logOut(const std::string& sessionKey);
  bool logOut(const StoredSession& session);

  // The sessions that have directories in any area, sorted by tag; the open one is included once it has been used.
  // Throws `FileUtilsIoException` when an area cannot be read.
  std::vector<StoredSession> sessions(SessionSizes sizes = SessionSizes::Skipped) const;

  // A snapshot of managers, stores, queues and, if it is to be measured, the trash: see Metrics.h. Creates nothing, and
  // waits for nothing that is under way: may be called on the stores' queues, in callbacks, and while a manager is
  // built or a session ends. The figures are read one after the other, and need not belong to one moment. Accesses no
  // file but with `TrashSize::Measured`, which reads the whole trash on the calling thread. Takes about a
  // tenth of a microsecond for each configured store. Throws nothing but `std::bad_alloc`.
  //
  // A session that is being ended is there until it has ended, with its last figures. Its managers then are as if they
  // had never been requested. What is counted begins anew whenever a store is created.
  [[nodiscard]] HostMetrics metrics(TrashSize trash = TrashSize::Skipped) const;

  // Ends the open sessions, if there are any, and also discards the data of the other managers that were requested.
  // Waits and throws as `logOut`.
  void invalidate() override;

  // The host's services, for your own use. Only `analytics` can be null.
  const std::shared_ptr<const Configuration>& configuration() const { return configuration_; }
  const std::shared_ptr<FileUtils>& files() const { return fileUtils_; }
  const std::shared_ptr<AnalyticsEventReporter>& analytics() const { return analytics_; }
  const std::shared_ptr<TaskQueueFactory>& queues() const { return taskQueueFactory_; }
  const std::shared_ptr<TrashCollector>& trash() const { return trash_; }
  const std::shared_ptr<AttributeStore>& attributes() const { return attributes_; }
  const std::shared_ptr<DiskSizeCalculator>& sizes() const { return sizes_; }
  const std::shared_ptr<LazyDispatcher>& lazyWork() const { return lazyWork_; }

 private:
  friend class Session;
  class IncidentGate;

  std::shared_ptr<Store> getStore(const std::string& identifier, const std::optional<std::string>& sessionKey);
  std::shared_ptr<Store> storeIn(const StoreManagerDefinition& definition, ManagerScope& scope, ManagerSlot& slot,
                                 const std::string& identifier);
  std::shared_ptr<StoreManager> managerIn(const StoreManagerDefinition& definition, ManagerScope& scope,
                                          ManagerSlot& slot);
  std::shared_ptr<StoreManager> build(const StoreManagerDefinition& definition, ManagerScope& scope,
                                      const ManagerFigures& figures);
  std::optional<std::string> keyOf(const std::string& tag) const;
  std::vector<ManagerMetrics> managerMetrics() const;

  bool isOpen(const std::shared_ptr<ManagerScope>& session) const;
  std::shared_ptr<StoreManager> managerOf(const std::shared_ptr<ManagerScope>& session, const std::string& name);
  std::shared_ptr<Store> storeOf(const std::shared_ptr<ManagerScope>& session, const std::string& identifier);
  bool end(const std::shared_ptr<ManagerScope>& session);

  static std::shared_ptr<IncidentGate> gateFor(std::function<void(const Incident&)> handler);
  static std::shared_ptr<const IncidentReporter> reporterThrough(const std::shared_ptr<IncidentGate>& gate,
                                                                 TaskQueueFactory& queues);
  std::shared_ptr<UnmanagedMeasuring> measuringEvery(std::chrono::seconds interval) const;
  void closeIncidentGate(std::chrono::seconds patience);
  bool endThreads();

  const std::shared_ptr<const Configuration> configuration_;
  const std::vector<std::string> managerNames_;  // sorted
  const std::shared_ptr<FileUtils> fileUtils_;
  const std::shared_ptr<const RootLock> rootLock_;  // null without `lockRoot`; released after all that follows
  const std::shared_ptr<StoreDirectoryNameBuilderFactory> nameBuilders_;
  const bool tagsTellKeys_;
  const std::function<std::string(const std::string&)> sessionTagMapper_;
  const bool runMaintenance_;
  const std::chrono::seconds shutDownPatience_;
  const std::shared_ptr<AnalyticsEventReporter> analytics_;
  const std::shared_ptr<ThreadQueueFactory> threads_;  // null if the queues came with the options
  const std::shared_ptr<TaskQueueFactory> taskQueueFactory_;
  const std::string trashPath_;
  const std::shared_ptr<TrashCollector> trash_;
  const std::shared_ptr<AttributeStore> attributes_;
  const std::shared_ptr<MeasuredSizes> measuredSizes_;
  const std::shared_ptr<DiskSizeCalculator> sizes_;  // the same
  const std::shared_ptr<LazyDispatcher> lazyWork_;
  const std::shared_ptr<AsyncExecutor> measuringQueue_;
  const std::shared_ptr<IncidentGate> incidentGate_;         // null: nobody is told of incidents
  const std::shared_ptr<const IncidentReporter> incidents_;  // null with the gate
  const std::shared_ptr<AsyncExecutor> pruningQueue_;        // null: managers prune at intervals only
  const std::chrono::seconds pruneDelay_;
  const std::shared_ptr<UnmanagedMeasuring> unmanaged_;  // null: the host does not measure while stores are in use
  const std::unique_ptr<SessionData> sessionData_;
  const std::unique_ptr<ManagerScopes> scopes_;
};

}  // namespace host
}  // namespace velmora::mobile::xplat::cellar
