// What a page of diagnostics shows of an application's storage.
// KIT: begin
#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/Host.h>

#include <iostream>
#include <string>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may

const char* const kStorage = R"({ "media": { "area": "caches", "max_size": "60MB", "stores": {
  "thumbs": { "type": "disk_cache", "lru_size_limit": "50MB" },
  "covers": { "type": "disk_cache", "lru_size_limit": "10MB" } } } })";

void show(const host::StoreMetrics& store) {
  std::cout << store.identifier << ": " << store.bytes.value_or(0) << " of " << store.maxBytes.value_or(0) << " bytes";
  if (!store.isCreated) std::cout << ", not used yet";
  if (const auto fetches = store.hits.value_or(0) + store.misses.value_or(0); fetches > 0) {
    std::cout << ", " << 100 * *store.hits / fetches << " % of " << fetches << " fetches found a value";
  }
  std::cout << '\n';
}

bool showsItsFigures(const std::string& directory) {
  host::Host host(kStorage, directory);
  const auto thumbs = host.store<DiskCache>("thumbs", "alice");
  host::await(thumbs->store("sunrise.jpg", {0xff, 0xd8}));
  static_cast<void>(host::await(thumbs->fetch("sunrise.jpg")));
  static_cast<void>(host::await(thumbs->fetch("sunset.jpg")));

  const host::HostMetrics metrics = host.metrics();         // at once, on any thread
  const host::ManagerMetrics& media = metrics.managers[0];  // of the session that is open
  for (const host::StoreMetrics& store : media.stores) show(store);
  std::cerr << toJson(host.metrics(host::TrashSize::Measured)) << '\n';  // to send: reads the trash, too
  return media.session == "alice" && media.stores[1].hits == 1 && media.stores[1].misses == 1 && metrics.queues;
}
// KIT: end

int main(int argc, char** argv) { return argc == 2 && showsItsFigures(argv[1]) ? 0 : 1; }
