// Errors that name the culprit. usage: kit-errors DIRECTORY

// KIT: begin
#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/Errors.h>
#include <cellar/host/Host.h>

#include <exception>
#include <iostream>
#include <stdexcept>
#include <string>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may

// "/papers/max_size, line 1, column 25"
std::string faultOf(const std::string& configuration, const std::string& directory) {
  try {
    const host::Host host(configuration, directory);
  } catch (const host::ConfigurationError& error) {
    return error.pointer() + ", line " + std::to_string(error.line()) + ", column " + std::to_string(error.column());
  }
  return "none";
}

// Which key of which store has failed, and how: the library's own exception is nested.
std::string culpritOf(host::Host& host) {
  const auto drafts = host.store<PersistentKeyValueStore>("drafts");
  const std::string key = "manifest_v1.sqlite";  // a name that stores with files keep for themselves
  try {
    host::await(host::naming(drafts->store(key, {'h', 'i'}), *drafts, key));
  } catch (const host::StoreError& error) {
    std::cerr << error.what() << '\n';
    try {
      std::rethrow_if_nested(error);
    } catch (const std::invalid_argument&) {
      return error.key() + " in " + error.store() + " can never be stored";
    }
  }
  return "none";
}
// KIT: end

#include <cstdlib>

int main(int argc, char** argv) {
  if (argc != 2) return EXIT_FAILURE;
  const std::string fault = faultOf(R"({"papers": {"max_size": "20mb"}})", argv[1]);
  host::Host host(R"({"papers": {"area": "documents", "stores": {"drafts": {"type": "pkvs", "has_version": true}}}})",
                  argv[1]);
  const std::string culprit = culpritOf(host);
  std::cout << fault << '\n' << culprit << '\n';
  const bool isRight = fault == "/papers/max_size, line 1, column 25" &&
                       culprit == "manifest_v1.sqlite in drafts_v1 can never be stored";
  return isRight ? EXIT_SUCCESS : EXIT_FAILURE;
}
