#include "host/Session.h"

#include <utility>

#include "host/Host.h"
#include "host/sessions/ManagerScopes.h"

namespace velmora::mobile::xplat::cellar::host {

Session::Session(Host& host, std::shared_ptr<ManagerScope> scope) : host_(&host), scope_(std::move(scope)) {}

const std::string& Session::key() const { return scope_->key; }

bool Session::isOpen() const { return host_->isOpen(scope_); }

std::shared_ptr<StoreManager> Session::manager(const std::string& name) const { return host_->managerOf(scope_, name); }

std::shared_ptr<Store> Session::getStore(const std::string& identifier) const {
  return host_->storeOf(scope_, identifier);
}

bool Session::end() const { return host_->end(scope_); }

}  // namespace velmora::mobile::xplat::cellar::host
