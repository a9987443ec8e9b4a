// The queues that an application has already, judged before the library gets them, and watched while it uses them.

// KIT: begin
#include <cellar/PersistentKeyValueStore.h>
#include <cellar/host/Await.h>
#include <cellar/host/Host.h>
#include <cellar/host/ThreadQueueFactory.h>
#include <cellar/host/testing/CheckedQueues.h>
#include <cellar/host/testing/QueueConformance.h>

#include <iostream>
#include <memory>
#include <string>
#include <utility>
#include <vector>

namespace cellar = velmora::mobile::xplat::cellar;

using MyQueues = cellar::host::ThreadQueueFactory;  // put the class of your own queues here

bool areFine(const std::vector<std::string>& violations) {
  for (const std::string& violation : violations) std::cerr << violation << '\n';
  return violations.empty();
}

int main(int argc, char** argv) {
  if (argc != 2) return 2;
  if (!areFine(cellar::test::checkConformance([] { return std::make_shared<MyQueues>(); }))) return 1;

  const auto checked = std::make_shared<cellar::test::CheckedQueues>(std::make_shared<MyQueues>());
  cellar::host::HostOptions options;
  options.configuration = R"({"media": {"stores": {"drafts": {"type": "pkvs"}}}})";
  options.root = argv[1];
  options.taskQueueFactory = checked;
  cellar::host::Host host(std::move(options));
  const auto drafts = host.store<cellar::PersistentKeyValueStore>("drafts", "alice");
  cellar::host::await(drafts->store("letter", {'h', 'i'}));
  host.logOut();
  return areFine(checked->violations()) ? 0 : 1;
}
// KIT: end
