// Values that expire each in its own time. usage: kit-expiring-values DIRECTORY

// KIT: begin
#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/Expiring.h>
#include <cellar/host/Host.h>

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <utility>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may

class Tokens {
 public:
  explicit Tokens(std::shared_ptr<PersistentKeyValueStore> store) : tokens_(std::move(store)) {}

  void keep(const std::string& server, const std::string& token, std::chrono::seconds validity) const {
    tokens_.put(server, token, validity - std::chrono::seconds(10));  // renewed before the server refuses it
  }

  std::string of(const std::string& server) const {
    return host::await(tokens_.get(server)).value_or("none");  // none was kept, or it has expired
  }

 private:
  host::ExpiringStore<std::string> tokens_;
};
// KIT: end

#include <cellar/host/testing/ManualClock.h>

#include <cstdlib>
#include <iostream>

int main(int argc, char** argv) {
  if (argc != 2) return EXIT_FAILURE;
  test::ManualClock clock(1'700'000'000);
  host::Host host(R"({"work": {"area": "documents", "stores": {"tokens": {"type": "pkvs", "has_version": true}}}})",
                  argv[1]);
  const Tokens tokens(host.store<PersistentKeyValueStore>("tokens"));
  tokens.keep("https://a.example", "4711", std::chrono::minutes(1));
  clock.advance(49);
  const std::string before = tokens.of("https://a.example");
  clock.advance(1);
  const std::string after = tokens.of("https://a.example");
  std::cout << before << ", then " << after << '\n';
  return before == "4711" && after == "none" ? EXIT_SUCCESS : EXIT_FAILURE;
}
