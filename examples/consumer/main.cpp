// An application that takes Cellar in from outside. usage: consumer STORAGE-DIRECTORY
#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/Host.h>

#include <exception>
#include <iostream>
#include <string>
#include <vector>

namespace cellar = velmora::mobile::xplat::cellar;

namespace {

constexpr const char* kConfiguration = R"({
  "application": { "stores": { "letters": { "type": "pkvs" }, "pictures": { "type": "disk_cache", "lru_size_limit": "1MB" } } }
})";

std::string textOf(const std::vector<unsigned char>& bytes) { return {bytes.begin(), bytes.end()}; }

// Its own class, linked against the library's table of virtual methods and type.
class CountingFiles : public cellar::FileUtils {
 public:
  std::vector<unsigned char> readFile(const std::string& path) override {
    ++reads;
    return FileUtils::readFile(path);
  }
  int reads = 0;
};

// Errors are caught as what they are across the border of the library.
bool unknownStoreIsAnError(cellar::host::Host& host) {
  try {
    host.store<cellar::DiskCache>("unknown", "alice");
  } catch (const cellar::LarderException& error) {
    return std::string(error.domain()) == "QZConfigurationErrorDomain";
  }
  return false;
}

bool keepsALetter(const std::string& directory) {
  cellar::host::Host host(kConfiguration, directory);
  const auto letters = host.store<cellar::PersistentKeyValueStore>("letters", "alice");
  cellar::host::await(letters->store("first", {'h', 'e', 'l', 'l', 'o'}));
  const auto found = cellar::host::await(letters->fetch("first"));
  CountingFiles files;
  files.writeFile(directory + "/note", {'n', 'o', 't', 'e'});
  files.readFile(directory + "/note");
  return found != nullptr && textOf(found->value) == "hello" && files.reads == 1 && unknownStoreIsAnError(host);
}

}  // namespace

int main(int argc, char** argv) {
  try {
    const bool kept = argc == 2 && keepsALetter(argv[1]);
    std::cout << (kept ? "The letter is there.\n" : "The letter is not there.\n");
    return kept ? 0 : 1;
  } catch (const std::exception& error) {
    std::cerr << "consumer: " << error.what() << '\n';
    return 1;
  }
}
