// expected: A pointer or a view does not contain what it refers to
#include <cellar/host/TypedStore.h>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: as in an application

void keep(const std::shared_ptr<PersistentKeyValueStore>& store) {
  host::TypedStore<const char*, host::TrivialCodec<const char*>>(store).put("a", "Novel");
}
