// expected: ignoring return value of .*nodiscard
#include <cellar/PersistentKeyValueStore.h>
#include <cellar/host/Await.h>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: as in an application

void read(PersistentKeyValueStore& store) { host::await(store.fetch("key")); }
