// expected: ignoring return value of .*nodiscard
#include <cellar/PersistentKeyValueStore.h>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: as in an application

void read(PersistentKeyValueStore& store) { store.fetch("key"); }
