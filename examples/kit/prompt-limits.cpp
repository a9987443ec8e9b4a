// Limits that are kept while the application runs. usage: kit-prompt-limits DIRECTORY

// KIT: begin
#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/Host.h>

#include <chrono>
#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may

std::unique_ptr<host::Host> openHost(const std::string& directory, std::chrono::seconds soon,
                                     std::function<void(const std::string& cache)> onTooLarge) {
  host::HostOptions options;
  options.configuration = R"({"photos": {"area": "caches", "stores": {
    "thumbs": {"type": "disk_cache", "lru_size_limit": "500KB"},
    "exports": {"type": "unmanaged", "is_cache": true, "max_size": "500KB"}}}})";
  options.root = directory;
  options.prune = host::Prune::Promptly;  // 3 seconds after a limit was exceeded by a tenth, unless you say when
  options.pruneDelay = soon;
  options.measureUnmanagedEvery = soon;  // a minute or more, in an application
  options.onIncident = [onTooLarge = std::move(onTooLarge)](const Incident& incident) {
    if (incident.kind == Incident::Kind::OverLimit) onTooLarge(incident.name);
  };
  return std::make_unique<host::Host>(std::move(options));
}

void storeTenTimesTheLimit(host::Host& host) {
  const auto thumbs = host.store<DiskCache>("thumbs", "alice");
  for (int i = 0; i < 100; ++i) host::await(thumbs->store(std::to_string(i), std::vector<unsigned char>(50 << 10)));
}
// KIT: end

#include <atomic>
#include <cstdlib>
#include <fstream>
#include <iostream>
#include <thread>

bool waitUntil(const std::function<bool()>& isSo) {
  for (int tenths = 0; tenths < 600; ++tenths) {
    if (isSo()) return true;
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
  }
  return false;
}

int main(int argc, char** argv) {
  if (argc != 2) return EXIT_FAILURE;
  std::atomic<bool> isTooLarge{false};
  const auto host = openHost(argv[1], std::chrono::seconds(1), [&](const std::string& cache) {
    std::cout << cache << " is too large\n";
    isTooLarge = true;
  });
  storeTenTimesTheLimit(*host);
  const auto photos = host->manager("photos");
  std::cout << "stored: " << photos->sizeOf("thumbs") << " bytes are there\n";
  const bool isPruned = waitUntil([&] { return photos->sizeOf("thumbs") <= 500 << 10; });
  std::cout << "later: " << photos->sizeOf("thumbs") << " bytes\n";

  const auto exports = host->store<UnmanagedStore>("exports");
  std::ofstream(exports->path + "/album") << std::string(600 << 10, 'x');
  return isPruned && waitUntil([&] { return isTooLarge.load(); }) ? EXIT_SUCCESS : EXIT_FAILURE;
}
