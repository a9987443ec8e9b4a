// What may be dropped: futures of changes, which a cache may forget about, and an `await` without a value.
#include <cellar/PersistentKeyValueStore.h>
#include <cellar/host/Await.h>
#include <cellar/host/Batches.h>
#include <cellar/host/Futures.h>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: as in an application

bool use(PersistentKeyValueStore& store) {
  store.store("key", {1, 2, 3});
  store.removeItem("other");
  store.store("waited for", {}).get();
  host::await(store.removeItem("key"));
  host::await(host::storeAll(store, {{"one", {1}}}), std::chrono::seconds(1));
  host::removeAll(store, {"one"});
  store.fetch("key").then([](auto&) {});
  return host::await(store.fetch("key")) != nullptr;
}
