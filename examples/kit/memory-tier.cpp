// Keeps thumbnails in memory in front of their cache. usage: kit-memory-tier NEW-DIRECTORY
// KIT: begin
#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/Host.h>
#include <cellar/host/MemoryTier.h>

#include <string>
#include <vector>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may

const char* const kStorage = R"({ "media": { "area": "caches", "stores": {
  "thumbs": { "type": "disk_cache", "lru_size_limit": "50MB" } } } })";

bool drawsWithoutTheDisk(const std::string& directory) {
  host::Host host(kStorage, directory);
  host::MemoryTier thumbs(host.store<DiskCache>("thumbs", "alice"), 8 << 20);  // at most 8 MiB in memory

  host::await(thumbs.store("sunrise.jpg", {0xff, 0xd8}));  // in memory at once; awaited: in the cache, too
  const auto shown = thumbs.find("sunrise.jpg");           // now or null: for the thread that draws

  thumbs.trim(0);                                                 // a memory warning
  const auto fetched = host::await(thumbs.fetch("sunrise.jpg"));  // from the cache, and into memory again
  const auto again = thumbs.find("sunrise.jpg");

  host.logOut();  // what is in memory is not served any more
  return shown != nullptr && *shown == *fetched && again == fetched && thumbs.find("sunrise.jpg") == nullptr;
}
// KIT: end

int main(int argc, char** argv) { return argc == 2 && drawsWithoutTheDisk(argv[1]) ? 0 : 1; }
