// Two accounts of one application, side by side.
// KIT: begin
#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/Host.h>

#include <iostream>
#include <optional>
#include <string>

namespace cellar = velmora::mobile::xplat::cellar;
using cellar::host::Session;

cellar::host::HostOptions withAccounts(const std::string& root) {
  cellar::host::HostOptions options;
  options.configuration = R"({"mail": {"area": "documents", "stores": {"drafts": {"type": "pkvs"}}}})";
  options.root = root;
  options.accounts = cellar::host::Accounts::Kept;
  return options;
}

int switchAccounts(cellar::host::Host& host) {
  const Session home = host.openSession("alice@home");
  const Session work = host.openSession("alice@work");  // both are open
  cellar::host::await(work.store<cellar::PersistentKeyValueStore>("drafts")->store("offer", {'4', '2'}));
  const auto none = cellar::host::await(home.store<cellar::PersistentKeyValueStore>("drafts")->fetch("offer"));
  for (const auto& session : host.sessions(cellar::host::SessionSizes::Measured)) {
    std::cout << session.key.value_or("?") << ": " << session.bytes.value_or(0) << " bytes\n";
  }
  work.end();  // logs out: the data of this account is discarded
  return none == nullptr && home.isOpen() && !work.isOpen() && host.sessions().size() == 1 ? 0 : 1;
}
// KIT: end

int main(int argc, char** argv) {
  if (argc != 2) return 2;
  cellar::host::Host host(withAccounts(argv[1]));
  return switchAccounts(host);
}
