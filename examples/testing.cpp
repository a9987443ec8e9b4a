// Tests of a host's own use of a store: nothing runs before the test says so, the disk fails on demand, events are
// kept. Exits with 0 when what it expects comes true.

#include <cstdlib>
#include <iostream>

// GUIDE: begin
#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/testing/FaultyFileUtils.h>
#include <cellar/host/testing/ManualQueue.h>
#include <cellar/host/testing/RecordingAnalytics.h>

#include <cerrno>
#include <memory>
#include <string>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: an example may

struct Surroundings {
  std::shared_ptr<test::ManualQueueFactory> queues = std::make_shared<test::ManualQueueFactory>();
  std::shared_ptr<test::FaultyFileUtils> files = std::make_shared<test::FaultyFileUtils>();
  std::shared_ptr<test::EventLog> events = std::make_shared<test::EventLog>();
  std::shared_ptr<AnalyticsEventReporter> reporter = test::recordingReporter(events);
};

std::shared_ptr<PersistentKeyValueStore> openDrafts(const Surroundings& with, const std::string& directory) {
  StoreServices services;
  services.queues = with.queues;
  services.files = with.files;
  services.analytics = with.reporter;
  services.trash = std::make_shared<TrashCollector>(directory + "/trash", with.files, nullptr, with.queues);
  KeyValueStoreOptions options;
  options.directory = directory + "/drafts";
  options.temporaryDirectory = directory + "/tmp";
  options.name = "drafts";
  return PersistentKeyValueStore::create(options, services);
}

// A draft is not there before the queues have run, and a full disk is an error that the caller sees.
bool draftsKeepTheirPromises(const std::string& directory) {
  const Surroundings with;
  const auto drafts = openDrafts(with, directory);

  Future<void> stored = drafts->store("letter", {'h', 'i'});
  const bool waits = with.files->calls(test::Operation::WriteFile) == 0;
  with.queues->runAll();
  host::await(std::move(stored));

  with.files->failNext(test::Operation::WriteFile, ENOSPC);
  Future<void> refused = drafts->store("novel", {'.'});
  with.queues->runAll();
  bool wasRefused = false;
  try {
    host::await(std::move(refused));
  } catch (const FileUtilsIoException& error) {
    wasRefused = error.code() == ENOSPC;
  }

  auto fetched = drafts->fetch("letter");
  with.queues->runAll();
  const bool found = host::await(std::move(fetched)) != nullptr;
  return waits && wasRefused && found && with.events->named("qzpkvs_access").size() == 1;
}
// GUIDE: end

int main(int argc, char** argv) {
  if (argc != 2) {
    std::cerr << "usage: testing DIRECTORY\n";
    return 2;
  }
  if (!draftsKeepTheirPromises(argv[1])) {
    std::cerr << "a promise was not kept\n";
    return EXIT_FAILURE;
  }
  std::cout << "all promises kept\n";
  return EXIT_SUCCESS;
}
