#include "host/sessions/ManagerScopes.h"

#include <algorithm>
#include <iterator>
#include <stdexcept>
#include <utility>

#include "LarderException.h"
#include "StoreManager.h"
#include "host/figures/ManagerFigures.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

std::shared_ptr<ManagerScope> makeScope(const std::string& key, const std::string& tag, bool isOpen) {
  auto scope = std::make_shared<ManagerScope>(key, tag);
  scope->isOpen = isOpen;
  return scope;
}

}  // namespace

ManagerScopes::ManagerScopes(bool severalSessions, SessionTagMapper sessionTagMapper)
    : severalSessions_(severalSessions),
      sessionTagMapper_(std::move(sessionTagMapper)),
      sessionless_(makeScope("", "", true)) {}

bool ManagerScopes::hasOpenedSession() const {
  const std::lock_guard<std::mutex> lock(mutex_);
  return hasOpenedSession_;
}

std::vector<std::shared_ptr<ManagerScope>> ManagerScopes::openSessions() const {
  const std::lock_guard<std::mutex> lock(mutex_);
  std::vector<std::shared_ptr<ManagerScope>> open;
  std::copy_if(sessions_.begin(), sessions_.end(), std::back_inserter(open),
               [](const auto& session) { return session->isOpen; });
  return open;
}

void ManagerScopes::setFigures(ManagerSlot& slot, std::shared_ptr<const ManagerFigures> figures) {
  const Lock lock(mutex_);
  slot.figures.swap(figures);
}

ScopeFigures ManagerScopes::figuresWithoutSession() const {
  const Lock lock(mutex_);
  return figuresOf(lock, *sessionless_);
}

std::map<std::string, ScopeFigures> ManagerScopes::figuresOfSessions() const {
  const Lock lock(mutex_);
  std::map<std::string, ScopeFigures> figures;
  for (const auto& session : sessions_) {
    if (session->isOpen) figures.emplace(session->tag, figuresOf(lock, *session));
  }
  return figures;
}

ScopeFigures ManagerScopes::figuresOf(const Lock& /*lock*/, const ManagerScope& scope) {
  ScopeFigures figures;
  for (const auto& [name, slot] : scope.managers) {
    if (slot.figures != nullptr) figures.emplace(name, slot.figures);
  }
  return figures;
}

std::shared_ptr<ManagerScope> ManagerScopes::findByTag(const Lock& /*lock*/, const std::string& tag) const {
  const auto found =
      std::find_if(sessions_.begin(), sessions_.end(), [&](const auto& session) { return session->tag == tag; });
  return found == sessions_.end() ? nullptr : *found;
}

// Null if none is open. Throws if there are several.
std::shared_ptr<ManagerScope> ManagerScopes::theOpenOne(const Lock& /*lock*/) const {
  std::shared_ptr<ManagerScope> open;
  for (const auto& session : sessions_) {
    if (!session->isOpen) continue;
    if (open != nullptr) throw std::logic_error("Several sessions are open, name the one you mean.");
    open = session;
  }
  return open;
}

bool ManagerScopes::isAnOpenOneEnding(const Lock& /*lock*/) const {
  return std::any_of(sessions_.begin(), sessions_.end(),
                     [](const auto& session) { return session->isOpen && session->isEnding; });
}

// The open session that a request with that key means; null if one is to be opened.
std::shared_ptr<ManagerScope> ManagerScopes::findOpen(const Lock& lock,
                                                      const std::optional<std::string>& sessionKey) const {
  if (!sessionKey) return theOpenOne(lock);
  for (const auto& session : sessions_) {
    if (!session->isOpen) continue;
    if (session->key == *sessionKey) return session;
    if (severalSessions_) continue;
    if (session->isEnding) return session;
    throw std::logic_error("Another session is open, log out before you ask for a new one.");
  }
  return nullptr;
}

std::shared_ptr<ManagerScope> ManagerScopes::findOrOpen(Lock& lock, const std::optional<std::string>& sessionKey) {
  if (auto open = findOpen(lock, sessionKey)) return open;
  const std::string key = sessionKey.value_or("");
  lock.unlock();
  const std::string tag = sessionTagMapper_(key);  // throws for a key that cannot name a directory
  lock.lock();
  if (auto open = findOpen(lock, sessionKey)) return open;
  if (const auto other = findByTag(lock, tag)) {
    if (!other->isOpen) throw InvalidatedException("The session is being logged out.");
    throw std::logic_error("Another session that would have the same directories, of tag '" + tag + "', is open.");
  }
  hasOpenedSession_ = true;
  return sessions_.emplace_back(makeScope(key, tag, true));
}

ManagerScopes::Request::Request(ManagerScopes& scopes) : Request(scopes, scopes.sessionless_) {}

ManagerScopes::Request::Request(ManagerScopes& scopes, const std::optional<std::string>& sessionKey) : scopes_(scopes) {
  Lock lock(scopes_.mutex_);
  scope_ = scopes_.findOrOpen(lock, sessionKey);
  if (scope_->isEnding) throw InvalidatedException("The managers are being invalidated.");
  ++scope_->requests;
}

ManagerScopes::Request::Request(ManagerScopes& scopes, std::shared_ptr<ManagerScope> session)
    : scopes_(scopes), scope_(std::move(session)) {
  const std::lock_guard<std::mutex> lock(scopes_.mutex_);
  if (!scope_->isOpen) throw InvalidatedException("The session of tag '" + scope_->tag + "' has ended.");
  if (scope_->isEnding) throw InvalidatedException("The managers are being invalidated.");
  ++scope_->requests;
}

ManagerScopes::Request::~Request() {
  const std::lock_guard<std::mutex> lock(scopes_.mutex_);
  --scope_->requests;
  scopes_.changed_.notify_all();
}

ManagerSlot& ManagerScopes::Request::slot(const std::string& managerName) const {
  const std::lock_guard<std::mutex> lock(scopes_.mutex_);
  return scope_->managers[managerName];
}

ManagerScopes::Ending::Ending(ManagerScopes& scopes) : scopes_(scopes) {
  Lock lock(scopes_.mutex_);
  scopes_.changed_.wait(lock, [this] { return !scopes_.sessionless_->isEnding; });
  scope_ = scopes_.sessionless_;
  begin(lock);
}

ManagerScopes::Ending::Ending(ManagerScopes& scopes, std::nullopt_t /*openSession*/) : scopes_(scopes) {
  Lock lock(scopes_.mutex_);
  scopes_.changed_.wait(lock, [&] { return !scopes_.isAnOpenOneEnding(lock); });
  scope_ = scopes_.theOpenOne(lock);
  begin(lock);
}

ManagerScopes::Ending::Ending(ManagerScopes& scopes, const std::string& tag) : scopes_(scopes) {
  Lock lock(scopes_.mutex_);
  scopes_.changed_.wait(lock, [&] {
    scope_ = scopes_.findByTag(lock, tag);
    return scope_ == nullptr || !scope_->isEnding;
  });
  if (scope_ == nullptr) scope_ = scopes_.sessions_.emplace_back(makeScope("", tag, false));
  begin(lock);
}

ManagerScopes::Ending::Ending(ManagerScopes& scopes, const std::shared_ptr<ManagerScope>& session) : scopes_(scopes) {
  Lock lock(scopes_.mutex_);
  scopes_.changed_.wait(lock, [&] { return !session->isEnding; });
  if (session->isOpen) scope_ = session;
  begin(lock);
}

void ManagerScopes::Ending::begin(Lock& lock) {
  if (scope_ == nullptr) return;
  scope_->isEnding = true;
  scopes_.changed_.wait(lock, [this] { return scope_->requests == 0; });
}

ManagerScopes::Ending::~Ending() {
  if (scope_ == nullptr) return;
  const std::lock_guard<std::mutex> lock(scopes_.mutex_);
  scope_->isEnding = false;
  if (scope_ != scopes_.sessionless_ && (hasEnded_ || !scope_->isOpen)) {
    scope_->isOpen = false;
    scopes_.sessions_.erase(std::find(scopes_.sessions_.begin(), scopes_.sessions_.end(), scope_));
  }
  scopes_.changed_.notify_all();
}

// No request uses the managers meanwhile.
void ManagerScopes::Ending::invalidateManagers() {
  for (auto& [name, slot] : scope_->managers) {
    if (slot.figures != nullptr) slot.figures->release();  // so that the stores end with the manager
    if (slot.manager != nullptr) slot.manager->invalidate();
    slot.manager = nullptr;
    scopes_.setFigures(slot, nullptr);
  }
  hasEnded_ = true;
}

}  // namespace velmora::mobile::xplat::cellar::host
