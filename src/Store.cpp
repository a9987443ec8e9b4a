#include "Store.h"

#include <stdexcept>
#include <utility>

#include "StoreDefinition.h"

namespace velmora::mobile::xplat::cellar {

Store::Store(const std::string& path_) : path(path_) {}

Store::~Store() = default;

void Store::pruneBackToNormal(std::function<void()> /*onSuccess*/,
                              std::function<void(const std::exception&)> /*onError*/, bool /*survivalMode*/) {
  throw std::logic_error("pruneBackToNormal not implemented or invalid call");
}

void Store::invalidateSoon() { invalidate(); }

void Store::keepUntilIdle() {}

UnmanagedStore::UnmanagedStore(const std::string& path_, std::shared_ptr<const StoreDefinition> definition_)
    : Store(path_), definition(std::move(definition_)) {}

UnmanagedStore::~UnmanagedStore() = default;

std::uint32_t UnmanagedStore::getMaxSize() const { return definition->maxSize; }

bool UnmanagedStore::isPrunable() { return false; }

void UnmanagedStore::invalidate() {}

}  // namespace velmora::mobile::xplat::cellar
