// expected: This type does not have a default codec. Name one
#include <cellar/host/TypedStore.h>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: as in an application

struct Draft {
  std::string title;
};

void keep(const std::shared_ptr<PersistentKeyValueStore>& store) { host::TypedStore<Draft>(store).put("a", {"Novel"}); }
