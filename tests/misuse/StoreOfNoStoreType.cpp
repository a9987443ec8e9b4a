// expected: A store is a DiskCache, a PersistentKeyValueStore or an UnmanagedStore
#include <cellar/host/Host.h>

#include <string>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: as in an application

void open(host::Host& host) { host.store<std::string>("drafts"); }
