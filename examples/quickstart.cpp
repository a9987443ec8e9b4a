// The first ten lines of a host. usage: quickstart [CONFIGURATION.json [STORAGE-DIRECTORY]]
#include <iostream>
#include <sstream>

// README: begin
#include <fstream>

#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/Host.h>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may

bool keepAPicture(const std::string& configuration, const std::string& directory) {
  host::Host host(configuration, directory);                     // queues, trash, sizes: everything, in one call
  const auto thumbs = host.store<DiskCache>("thumbs", "alice");  // of the session "alice"
  host::await(thumbs->store("sunrise.jpg", {0xff, 0xd8}));       // written on the store's queues, never on this thread
  const auto found = host::await(thumbs->fetch("sunrise.jpg"));  // null would be a miss
  const auto web = host.store<UnmanagedStore>("web");            // a plain directory; over its limit it opens empty
  std::ofstream(web->path + "/page.html") << "hello";
  return found != nullptr && found->value.size() == 2;
}
// README: end

int main(int argc, char** argv) {
  std::ifstream file(argc > 1 ? argv[1] : "quickstart.json");
  std::stringstream configuration;
  configuration << file.rdbuf();
  const bool kept = keepAPicture(configuration.str(), argc > 2 ? argv[2] : "quickstart-data");
  std::cout << (kept ? "The picture is there.\n" : "The picture is not there.\n");
  return kept ? 0 : 1;
}
