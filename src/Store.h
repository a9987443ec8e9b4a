#pragma once

#include <cstdint>
#include <exception>
#include <functional>
#include <memory>
#include <string>

#include "Export.h"

namespace velmora::mobile::xplat::cellar {

class StoreDefinition;

// A directory with a policy, handed out by a manager and always held by shared pointers.
class CELLAR_EXPORT Store : public std::enable_shared_from_this<Store> {
 public:
  explicit Store(const std::string& path);
  virtual ~Store();
  Store(const Store&) = delete;
  Store& operator=(const Store&) = delete;

  // Whether the manager may ask this store to prune itself.
  virtual bool isPrunable() = 0;

  // Refuses all work from now on. The data is the manager's to discard.
  virtual void invalidate() = 0;

  // Shrinks the store to its normal size, or to its survival size when the device is short of space, and calls one of
  // the two when it is done, on a queue of the store's or on this thread. A store that is not prunable throws
  // `std::logic_error`.
  virtual void pruneBackToNormal(std::function<void()> onSuccess, std::function<void(const std::exception&)> onError,
                                 bool survivalMode);

  // Invalidates without waiting for what is under way. By default the same as `invalidate`.
  virtual void invalidateSoon();

  // Keeps the store alive until the operations that it has accepted so far are finished on its queues. Does not wait.
  // By default does nothing.
  virtual void keepUntilIdle();

  // A weak pointer to this store as a T; empty when it is not owned by a shared pointer, or no T.
  template <class T> std::weak_ptr<T> weak_from_this() { return std::dynamic_pointer_cast<T>(weak_from_this().lock()); }
  using std::enable_shared_from_this<Store>::weak_from_this;

  const std::string path;  // the store's directory
};

// A directory that the host fills as it likes. The library only measures it, and empties it when it is a cache that is
// over its limit as it is first handed out.
class CELLAR_EXPORT UnmanagedStore : public Store {
 public:
  UnmanagedStore(const std::string& path, std::shared_ptr<const StoreDefinition> definition);
  ~UnmanagedStore() override;

  // The configured limit in bytes; 0 when none was configured.
  std::uint32_t getMaxSize() const;

  bool isPrunable() override;  // never

  void invalidate() override;  // there is nothing to close: does nothing

  const std::shared_ptr<const StoreDefinition> definition;
};

}  // namespace velmora::mobile::xplat::cellar
