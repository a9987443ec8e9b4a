#pragma once

#include <condition_variable>
#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include <cellar/Incident.h>

namespace velmora::mobile::xplat::cellar {

class StoreManager;

namespace host {

class ManagerFigures;

// One manager; null until it is built.
struct ManagerSlot {
  std::mutex mutex{};  // guards the manager; held while it is built
  std::shared_ptr<StoreManager> manager{};
  std::shared_ptr<const ManagerFigures> figures{};  // null with the manager; guarded by the mutex of the scopes
};

// What is known of the managers of a scope that have been built, by name.
using ScopeFigures = std::map<std::string, std::shared_ptr<const ManagerFigures>>;

// The managers of one session, or those of none. What follows `isAdopted` is guarded by the mutex of the scopes.
struct ManagerScope {
  ManagerScope(std::string sessionKey, std::string sessionTag)
      : key(std::move(sessionKey)), tag(std::move(sessionTag)) {}

  const std::string key;
  const std::string tag;

  std::mutex adoption{};   // held while the session's data is moved from where it was kept before
  bool isAdopted = false;  // guarded by `adoption`

  std::map<std::string, ManagerSlot> managers{};  // by name; grows only
  std::size_t requests = 0;                       // under way
  bool isOpen = false;                            // not while a session that is not open is discarded
  bool isEnding = false;                          // further requests are refused
};

// Which sessions are open, who is using their managers, and which are being ended.
class ManagerScopes {
 public:
  using SessionTagMapper = std::function<std::string(const std::string& sessionKey)>;

  ManagerScopes(bool severalSessions, SessionTagMapper sessionTagMapper);

  // A request in progress: its scope is not ended during it. Refused (`InvalidatedException`) while that is being
  // ended: if a callback on a store's queue waited here, it would deadlock with the end of that store.
  class Request {
   public:
    // Of the managers without session scope.
    explicit Request(ManagerScopes& scopes);
    // Of a session, which is opened if it is not; without a key, of the open one. Throws `std::logic_error` if another
    // one is open, or several are and there is no key, and what the mapper throws.
    Request(ManagerScopes& scopes, const std::optional<std::string>& sessionKey);
    // Of a session that must still be open.
    Request(ManagerScopes& scopes, std::shared_ptr<ManagerScope> session);
    ~Request();
    Request(const Request&) = delete;
    Request& operator=(const Request&) = delete;

    const std::shared_ptr<ManagerScope>& scope() const { return scope_; }
    ManagerSlot& slot(const std::string& managerName) const;

   private:
    const IncidentDeferral deferral_;  // a handler may make requests of its own
    ManagerScopes& scopes_;
    std::shared_ptr<ManagerScope> scope_;
  };

  // The time in which a scope refuses requests. One at a time for each; begins when the requests in progress have
  // finished. Afterwards a session that is not open any more is forgotten.
  class Ending {
   public:
    // Of the managers without session scope.
    explicit Ending(ManagerScopes& scopes);
    // Of the open session; there must not be several (`std::logic_error`).
    Ending(ManagerScopes& scopes, std::nullopt_t openSession);
    // Of the session with that tag, whether it is open or not.
    Ending(ManagerScopes& scopes, const std::string& tag);
    // Of that session, if it is still open.
    Ending(ManagerScopes& scopes, const std::shared_ptr<ManagerScope>& session);
    ~Ending();
    Ending(const Ending&) = delete;
    Ending& operator=(const Ending&) = delete;

    // Null when there is nothing to end.
    const std::shared_ptr<ManagerScope>& scope() const { return scope_; }

    // Invalidates the managers, which discards their data; with this object the session ends then. If one throws, the
    // next attempt continues there.
    void invalidateManagers();

   private:
    void begin(std::unique_lock<std::mutex>& lock);

    ManagerScopes& scopes_;
    std::shared_ptr<ManagerScope> scope_;
    bool hasEnded_ = false;
  };

  // Of a manager that has just been built.
  void setFigures(ManagerSlot& slot, std::shared_ptr<const ManagerFigures> figures);

  // Of the managers without session scope, and of those of the open sessions, by tag. Waits for nobody.
  ScopeFigures figuresWithoutSession() const;
  std::map<std::string, ScopeFigures> figuresOfSessions() const;

  bool hasOpenedSession() const;  // since the scopes were created
  std::vector<std::shared_ptr<ManagerScope>> openSessions() const;

 private:
  using Lock = std::unique_lock<std::mutex>;

  std::shared_ptr<ManagerScope> findByTag(const Lock& lock, const std::string& tag) const;
  std::shared_ptr<ManagerScope> findOpen(const Lock& lock, const std::optional<std::string>& sessionKey) const;
  std::shared_ptr<ManagerScope> findOrOpen(Lock& lock, const std::optional<std::string>& sessionKey);
  std::shared_ptr<ManagerScope> theOpenOne(const Lock& lock) const;
  bool isAnOpenOneEnding(const Lock& lock) const;
  static ScopeFigures figuresOf(const Lock& lock, const ManagerScope& scope);

  const bool severalSessions_;
  const SessionTagMapper sessionTagMapper_;

  mutable std::mutex mutex_;         // guards the rest, and the scopes; not held while other objects are called
  std::condition_variable changed_;  // a scope's requests, or its end
  const std::shared_ptr<ManagerScope> sessionless_;
  std::vector<std::shared_ptr<ManagerScope>> sessions_;  // that are open, or being ended
  bool hasOpenedSession_ = false;
};

}  // namespace host
}  // namespace velmora::mobile::xplat::cellar
