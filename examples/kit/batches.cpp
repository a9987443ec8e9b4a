// Many keys, one future. usage: kit-batches DIRECTORY
#include <iostream>

// KIT: begin
#include <cellar/PersistentKeyValueStore.h>
#include <cellar/host/Await.h>
#include <cellar/host/Batches.h>
#include <cellar/host/Host.h>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may

bool keepAnAlbum(const std::string& directory) {
  host::Host host(R"({"albums": {"area": "documents", "stores": {"pictures": {"type": "pkvs"}}}})", directory);
  const auto pictures = host.store<PersistentKeyValueStore>("pictures");
  host::await(host::storeAll(*pictures, {{"cat", {1, 2, 3}}, {"dog", {4, 5}}, {"gnu", {6}}}));
  host::await(host::removeAll(*pictures, {"gnu"}));

  std::string refused;
  try {  // the name of a file of the store's own cannot be a key
    host::await(host::storeAll(*pictures, {{"manifest_v1.sqlite", {7}}, {"owl", {8}}}));
  } catch (const host::BatchError& error) {
    refused = error.key();
  }

  const auto found = host::await(host::fetchMany(*pictures, {"owl", "gnu", "cat"}));
  const bool isRight = found[0] != nullptr && found[1] == nullptr && found[2]->value.size() == 3;
  return isRight && refused == "manifest_v1.sqlite";
}
// KIT: end

int main(int argc, char** argv) {
  if (argc != 2) return 2;
  const bool isKept = keepAnAlbum(argv[1]);
  std::cout << (isKept ? "The album is there.\n" : "The album is not as it should be.\n");
  return isKept ? 0 : 1;
}
