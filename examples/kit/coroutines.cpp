// A page that waits for its pictures without a thread. usage: kit-coroutines DIRECTORY
#include <iostream>

// KIT: begin
#include <cellar/DiskCache.h>
#include <cellar/host/Await.h>
#include <cellar/host/Coroutines.h>
#include <cellar/host/Host.h>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may

// Continues on that queue whenever a picture has come. Takes all by value: references may dangle by then.
Future<std::size_t> sizeOfPage(std::shared_ptr<DiskCache> pictures, std::vector<std::string> names,
                               std::shared_ptr<AsyncExecutor> queue) {
  std::size_t size = 0;
  for (const std::string& name : names) {
    const auto picture = co_await host::resumeOn(pictures->fetch(name), queue);
    if (picture != nullptr) size += picture->value.size();
  }
  co_return size;
}

std::size_t sizeOfThreePictures(const std::string& directory) {
  host::Host host(R"({"media": {"area": "caches", "stores": {"pictures": {"type": "disk_cache"}}}})", directory);
  const auto pictures = host.store<DiskCache>("pictures");
  pictures->store("cat", {1, 2, 3});
  pictures->store("dog", {4, 5});
  return host::await(sizeOfPage(pictures, {"cat", "dog", "gnu"}, host.queues()->createWorkQueue()));
}
// KIT: end

int main(int argc, char** argv) {
  if (argc != 2) return 2;
  const std::size_t size = sizeOfThreePictures(argv[1]);
  std::cout << size << " bytes\n";
  return size == 5 ? 0 : 1;
}
