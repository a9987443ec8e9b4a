// Downloads a picture once for all who want it. usage: kit-computing-once NEW-DIRECTORY
// KIT: begin
#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/Host.h>
#include <cellar/host/MemoryTier.h>
#include <cellar/host/ThreadQueueFactory.h>

#include <atomic>
#include <string>
#include <vector>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may
using Bytes = host::MemoryTier::Bytes;

const char* const kStorage = R"({ "media": { "area": "caches", "stores": {
  "thumbs": { "type": "disk_cache", "lru_size_limit": "50MB" } } } })";

bool downloadsOnce(const std::string& directory) {
  host::ThreadQueueFactory queues;
  const auto network = queues.createQueue();
  host::Host host(kStorage, directory);
  host::MemoryTier thumbs(host.store<DiskCache>("thumbs", "alice"), 8 << 20);  // 0: nothing in memory

  std::atomic<int> downloads{0};
  const auto download = [&] {
    return dispatchTask<Bytes>(network, [&]() -> Bytes {
      return {0xff, 0xd8, static_cast<unsigned char>(++downloads)};
    });
  };
  const auto list = thumbs.fetchOrCompute("sunrise.jpg", download);
  const auto detail = thumbs.fetchOrCompute("sunrise.jpg", download);  // waits for the same download
  const auto first = host::await(list);
  return *first == *host::await(detail) && *first == *host::await(thumbs.fetch("sunrise.jpg")) && downloads == 1;
}
// KIT: end

int main(int argc, char** argv) { return argc == 2 && downloadsOnce(argv[1]) ? 0 : 1; }
