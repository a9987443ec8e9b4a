#pragma once

#include <memory>
#include <string>

#include <cellar/Export.h>
#include <cellar/StoreManager.h>

namespace velmora::mobile::xplat::cellar::host {

class Host;
struct ManagerScope;

// A session of a host that has been opened, an account that is logged in for example. Copies mean the same session.
// Nothing ends with the last of them: the session stays open, and its data is kept. The host must outlive all uses. Any
// thread may call.
class CELLAR_EXPORT Session {
 public:
  const std::string& key() const;

  // Until it is ended, here or by the host. A session that is opened again under the same key is another one.
  bool isOpen() const;

  // As those of the host, for this session. Throws `InvalidatedException` when the session has ended. A manager without
  // session scope, and its stores, are the same for all sessions.
  std::shared_ptr<StoreManager> manager(const std::string& name) const;
  template <class StoreType> std::shared_ptr<StoreType> store(const std::string& storeIdentifier) const {
    return cellar::detail::storeAs<StoreType>(storeIdentifier, getStore(storeIdentifier));
  }

  // Ends the session and discards its data. False if it has ended already. Waits and throws as `Host::logOut` with its
  // key: on the host's own threads `std::logic_error`, and what could not be discarded although the session has ended.
  bool end() const;

 private:
  friend class Host;
  Session(Host& host, std::shared_ptr<ManagerScope> scope);
  std::shared_ptr<Store> getStore(const std::string& identifier) const;

  Host* host_;
  std::shared_ptr<ManagerScope> scope_;
};

}  // namespace velmora::mobile::xplat::cellar::host
