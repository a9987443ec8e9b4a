// How an application tests what it does with Cellar: queues that the test runs, files that fail when it says so.
#include <cellar/Cellar.h>
#include <cellar/host/Await.h>
#include <cellar/host/testing/FaultyFileUtils.h>
#include <cellar/host/testing/ManualQueue.h>

#include <cerrno>
#include <iostream>
#include <memory>
#include <string>
#include <utility>

namespace cellar = velmora::mobile::xplat::cellar;

namespace {

bool aFullDiskIsReported(const std::string& directory) {
  const auto files = std::make_shared<cellar::test::FaultyFileUtils>();
  const auto queues = std::make_shared<cellar::test::ManualQueueFactory>();
  const auto trash = std::make_shared<cellar::TrashCollector>(directory + "/trash", files, nullptr, queues);
  cellar::KeyValueStoreOptions options;
  options.directory = directory + "/letters";
  options.temporaryDirectory = directory + "/tmp";
  options.name = "letters";
  const auto letters = cellar::PersistentKeyValueStore::create(options, {queues, trash, files, nullptr});
  files->failNext(cellar::test::Operation::WriteFile, ENOSPC);
  cellar::Future<void> stored = letters->store("first", {'h', 'i'});
  queues->runAll();
  try {
    cellar::host::await(std::move(stored));
  } catch (const cellar::FileUtilsIoException& error) {
    return error.code() == ENOSPC;
  }
  return false;
}

}  // namespace

int main(int argc, char** argv) {
  const bool isReported = argc == 2 && aFullDiskIsReported(argv[1]);
  std::cout << (isReported ? "The full disk was reported to the caller.\n" : "The full disk was not reported.\n");
  return isReported ? 0 : 1;
}
