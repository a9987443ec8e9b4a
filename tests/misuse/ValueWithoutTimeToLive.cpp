// expected: Say how long this value lives: put(key, value, timeToLive)
#include <cellar/host/Expiring.h>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: as in an application

void keep(const std::shared_ptr<PersistentKeyValueStore>& store) {
  host::ExpiringStore<std::string>(store).put("a", "Novel");
}
