// expected: Only a Future<void> has get(). Take a value in the callback of then(), or wait for it with
#include <cellar/PersistentKeyValueStore.h>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: as in an application

bool isThere(PersistentKeyValueStore& store) { return store.fetch("key").get() != nullptr; }
