// What becomes of several fetches, with one wait. usage: kit-futures DIRECTORY
#include <iostream>

// KIT: begin
#include <cellar/DiskCache.h>
#include <cellar/host/Await.h>
#include <cellar/host/Futures.h>
#include <cellar/host/Host.h>

#include <numeric>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may

using Found = std::unique_ptr<PersistentKeyValueStore::FetchResult>;

// How many bytes a page's pictures have together; nobody waits for them here.
Future<std::size_t> sizeOfPage(DiskCache& pictures, const std::vector<std::string>& names) {
  std::vector<Future<std::size_t>> sizes;
  for (const std::string& name : names) {
    const auto sizeOf = [](const Found& picture) { return picture == nullptr ? 0U : picture->value.size(); };
    sizes.push_back(host::map(pictures.fetch(name), sizeOf));
  }
  return host::map(host::whenAll(std::move(sizes)), [](const std::vector<std::size_t>& all) {
    return std::accumulate(all.begin(), all.end(), std::size_t{0});
  });
}

std::string describePage(const std::string& directory) {
  host::Host host(R"({"media": {"area": "caches", "stores": {"pictures": {"type": "disk_cache"}}}})", directory);
  const auto pictures = host.store<DiskCache>("pictures");
  pictures->store("cat", {1, 2, 3});  // what is called later comes behind this
  pictures->store("dog", {4, 5});
  try {
    return std::to_string(host::await(sizeOfPage(*pictures, {"cat", "dog", "gnu"}), std::chrono::seconds(10))) +
           " bytes";
  } catch (const host::TimeoutError&) {
    return "still loading";
  }
}
// KIT: end

int main(int argc, char** argv) {
  if (argc != 2) return 2;
  const std::string description = describePage(argv[1]);
  std::cout << description << '\n';
  return description == "5 bytes" ? 0 : 1;
}
