// What a host tells of incidents, and when.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <atomic>
#include <cerrno>
#include <chrono>
#include <functional>
#include <future>
#include <memory>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "Future.h"
#include "Incident.h"
#include "LarderException.h"
#include "LazyDispatcher.h"
#include "PersistentKeyValueStore.h"
#include "Store.h"
#include "StoreManager.h"
#include "TrashCollector.h"
#include "host/Await.h"
#include "host/Host.h"
#include "host/RootLock.h"
#include "host/ThreadQueueFactory.h"
#include "host/testing/ManualQueue.h"
#include "support/Barrier.h"
#include "support/IncidentLog.h"
#include "support/LogCapture.h"
#include "support/ManagerServices.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using test::DiskOfChosenSize;
using test::Latch;
using test::LogCapture;
using test::ManualExecutor;
using test::ManualQueueFactory;
using test::Operation;
using test::TemporaryDirectory;
using test::Watchdog;
using testing::ElementsAre;
using testing::IsEmpty;
using testing::SizeIs;
using testing::StartsWith;

constexpr unsigned int kLongEnough = 60;  // seconds, for whatever does not hang
constexpr std::chrono::hours kLongPatience(1);

const char* const kConfiguration = R"({"media": {"session_scoped": false, "stores": {
  "thumbs": {"type": "unmanaged"},
  "letters": {"type": "pkvs"}
}}})";

using Handler = std::function<void(const Incident&)>;

class HostIncidents : public testing::Test {
 protected:
  // What waits on a queue may hold the queue.
  void TearDown() override {
    host.reset();
    queues->runAll();
  }

  // With a handler that keeps what it is given and then calls `onIncident`.
  HostOptions options(std::shared_ptr<TaskQueueFactory> factory = nullptr) {
    HostOptions options;
    options.configuration = kConfiguration;
    options.root = directory.path();
    options.lazyDelaySeconds = 3600;
    options.shutDownPatience = kLongPatience;
    options.fileUtils = files;
    options.taskQueueFactory = std::move(factory);
    options.onIncident = [this](const Incident& incident) {
      told.push_back(test::textOf(incident));
      if (onIncident) onIncident(incident);
    };
    return options;
  }

  // On manual queues.
  void start() { host = std::make_unique<Host>(options(queues)); }

  // A handler that is under way until it is released.
  struct HeldHandler {
    void hold() {
      begun.countDown();
      release.wait();
      isOver = true;
    }
    Latch begun{1};
    Latch release{1};
    std::atomic<bool> isOver{false};
  };

  // The queue that incidents wait on. Only before a manager is built.
  static std::shared_ptr<ManualExecutor> queueOfIncidents(const ManualQueueFactory& factory) {
    return factory.workQueue(factory.workQueueCount() - 1);
  }

  void failToCreate() {
    files->failPath(Operation::CreateDirectory, pathOfThumbs, EIO);
    EXPECT_THROW(host->store<Store>("thumbs"), FileUtilsIoException);
  }

  const std::string pathOfManager() const { return directory.file("caches/_sessionlessStore"); }

  const Watchdog watchdog{kLongEnough};
  const LogCapture log;
  const TemporaryDirectory directory;
  const std::string pathOfThumbs = directory.file("caches/_sessionlessStore/thumbs__v1");
  const std::shared_ptr<DiskOfChosenSize> files = std::make_shared<DiskOfChosenSize>();
  const std::shared_ptr<ManualQueueFactory> queues = std::make_shared<ManualQueueFactory>();
  Handler onIncident;
  std::vector<std::string> told;
  std::unique_ptr<Host> host;
};

// What is told

TEST_F(HostIncidents, TellOfEachAttemptToCreateAStoreThatFails) {
  start();
  failToCreate();
  EXPECT_THAT(told, IsEmpty());  // before the queue runs
  failToCreate();
  queues->runAll();
  const auto ofThumbs = StartsWith("CreationFailed thumbs: Could not create store \"thumbs\": ");
  EXPECT_THAT(told, ElementsAre(ofThumbs, ofThumbs));
}

TEST_F(HostIncidents, TellOfAStoreThatCannotBeCreatedInTheBackground) {
  start();
  host->manager("media");
  files->failPath(Operation::CreateDirectory, pathOfThumbs, EIO);
  host->lazyWork()->dispatchNow();
  queues->runAll();
  EXPECT_THAT(told, ElementsAre(StartsWith("CreationFailed thumbs: ")));
}

TEST_F(HostIncidents, TellOfAManagerThatIsDiscardedForTheSizeOfItsFileSystem) {
  directory.write("caches/_sessionlessStore/thumbs__v1/file", "bytes");
  files->total = 1;
  start();
  host->manager("media");
  queues->runAll();
  EXPECT_THAT(told, ElementsAre(StartsWith("ManagerDiscarded " + pathOfManager() + ": Discarding manager directory")));
}

TEST_F(HostIncidents, TellOfAStoreThatIsPurged) {
  directory.write("caches/_sessionlessStore/letters__v1/manifest_v1.sqlite", std::string(20'000, 'G'));
  start();
  const auto letters = host->store<PersistentKeyValueStore>("letters");
  queues->runAll();
  EXPECT_THAT(told,
              ElementsAre(StartsWith("StorePurged letters: Store \"letters\" purged due to corrupted manifest. ")));
}

TEST_F(HostIncidents, TellOfTrashThatIsStuck) {
  start();
  files->failAlways(Operation::DeleteFile, EBUSY);
  EXPECT_TRUE(host->trash()->collectPath(directory.write("file", "")));
  queues->runAll();
  EXPECT_THAT(told, ElementsAre(StartsWith("TrashStuck " + directory.file("trash") + ": Cannot collect trash. ")));
}

TEST_F(HostIncidents, HaveNoQueueWithoutAHandler) {
  HostOptions silent = options(queues);
  silent.onIncident = nullptr;
  host = std::make_unique<Host>(std::move(silent));
  const std::size_t without = queues->workQueueCount();
  failToCreate();
  const auto others = std::make_shared<ManualQueueFactory>();
  host.reset();
  host = std::make_unique<Host>(options(others));
  EXPECT_EQ(others->workQueueCount(), without + 1);
  EXPECT_THAT(told, IsEmpty());
  host.reset();
  others->runAll();
}

// The handler

TEST_F(HostIncidents, AreToldToAHandlerThatMayUseTheHost) {
  onIncident = [&](const Incident&) {
    files->heal();
    EXPECT_NE(host->store<UnmanagedStore>("thumbs"), nullptr);
  };
  start();
  failToCreate();
  queues->runAll();
  EXPECT_THAT(told, SizeIs(1));
}

TEST_F(HostIncidents, AreToldToAHandlerThatMayUseTheHostOnItsOwnThreads) {
  Latch isDone(1);
  onIncident = [&](const Incident&) {
    files->heal();
    EXPECT_NE(host->store<UnmanagedStore>("thumbs"), nullptr);
    EXPECT_THROW(host->logOut(), std::logic_error);
    isDone.countDown();
  };
  host = std::make_unique<Host>(options());
  failToCreate();
  isDone.wait();
  host.reset();  // the call may not be over
}

TEST_F(HostIncidents, AreToldAtOnceOnlyWhenTheRequestIsOver) {
  directory.write("caches/_sessionlessStore/thumbs__v1/file", "bytes");
  files->total = 1;
  std::shared_ptr<StoreManager> heard;
  onIncident = [&](const Incident& incident) {
    heard = host->manager("media");
    if (incident.kind == Incident::Kind::ManagerDiscarded) return;
    files->heal();
    EXPECT_NE(host->store<UnmanagedStore>("thumbs"), nullptr);
    host->invalidate();  // waits for requests
  };
  start();
  queueOfIncidents(*queues)->onDispatch = [queue = queueOfIncidents(*queues).get()] { queue->runAll(); };
  const auto manager = host->manager("media");
  EXPECT_THAT(told, ElementsAre(StartsWith("ManagerDiscarded ")));
  EXPECT_EQ(heard, manager);
  failToCreate();
  EXPECT_THAT(told, SizeIs(2));
  EXPECT_FALSE(manager->isValid());
}

TEST_F(HostIncidents, AreToldToAHandlerThatThrowsAndIsToldOfTheNextAllTheSame) {
  onIncident = [](const Incident&) { throw std::runtime_error("no"); };
  start();
  failToCreate();
  failToCreate();
  queues->runAll();
  EXPECT_THAT(told, SizeIs(2));
  EXPECT_THAT(log.messages(),
              ElementsAre("The handler of an incident failed: no", "The handler of an incident failed: no"));
}

TEST_F(HostIncidents, OnAQueueThatRefusesThemAreOneLineInTheLogAndChangeNothingElse) {
  start();
  const auto queue = queueOfIncidents(*queues);
  queue->throwOnDispatch(true);
  failToCreate();
  ASSERT_THAT(log.messages(), ElementsAre(StartsWith("Could not report an incident: ")));
  queue->throwOnDispatch(false);
  failToCreate();
  files->heal();
  EXPECT_NE(host->store<UnmanagedStore>("thumbs"), nullptr);
  queues->runAll();
  EXPECT_THAT(told, SizeIs(1));
}

TEST_F(HostIncidents, ThatAreHandledSlowlyHoldUpNothingElse) {
  Latch begun(1);
  Latch release(1);
  onIncident = [&](const Incident&) {
    begun.countDown();
    release.wait();
  };
  host = std::make_unique<Host>(options());
  failToCreate();
  begun.wait();
  const auto letters = host->store<PersistentKeyValueStore>("letters");
  await(letters->store("key", {1}));
  EXPECT_NE(await(letters->fetch("key")), nullptr);
  release.countDown();
  host.reset();  // the call may not be over
}

// The end of the host

TEST_F(HostIncidents, ReportedBeforeTheHostIsDestroyedAreHandedOver) {
  onIncident = [](const Incident&) { std::this_thread::sleep_for(std::chrono::milliseconds(2)); };
  host = std::make_unique<Host>(options());
  for (int i = 0; i < 20; ++i) failToCreate();
  host.reset();
  EXPECT_THAT(told, SizeIs(20));
}

TEST_F(HostIncidents, AreNotToldOnceTheHostIsGoneThoughQueuesAndStoresGoOn) {
  start();
  const auto letters = host->store<PersistentKeyValueStore>("letters");
  queues->runAll();
  failToCreate();
  const auto trash = host->trash();
  host.reset();
  files->heal();
  files->failAlways(Operation::DeleteFile, EBUSY);
  trash->collectPath(directory.write("file", ""));
  queues->runAll();
  EXPECT_TRUE(log.contains("Cannot collect trash. "));
  EXPECT_THAT(told, IsEmpty());
}

TEST_F(HostIncidents, KeepNothingOfTheHandlerOnceTheHostIsGone) {
  const auto captured = std::make_shared<int>(1);
  HostOptions capturing = options(queues);
  capturing.onIncident = [captured](const Incident&) {};
  host = std::make_unique<Host>(std::move(capturing));
  const auto manager = host->manager("media");
  EXPECT_GT(captured.use_count(), 1);
  host.reset();
  EXPECT_EQ(captured.use_count(), 1);
}

// On queues that the host does not wait for.
TEST_F(HostIncidents, HaveTheDestructorWaitForACallThatIsUnderWay) {
  const auto threads = std::make_shared<ThreadQueueFactory>();
  HeldHandler handler;
  onIncident = [&](const Incident&) { handler.hold(); };
  host = std::make_unique<Host>(options(threads));
  failToCreate();
  failToCreate();
  handler.begun.wait();
  std::atomic<bool> wasOver{false};
  std::thread ending([&] {
    host.reset();
    wasOver = handler.isOver.load();
  });
  std::this_thread::sleep_for(std::chrono::milliseconds(20));
  handler.release.countDown();
  ending.join();
  EXPECT_TRUE(wasOver);
  EXPECT_TRUE(threads->drain(kLongPatience));
  EXPECT_LE(told.size(), 2U);  // the second call may have begun before the destructor
}

TEST_F(HostIncidents, HaveTheDestructorWaitForACallThatIsUnderWayOnAQueueOfTheHostToo) {
  HeldHandler handler;
  onIncident = [&](const Incident&) { handler.hold(); };
  host = std::make_unique<Host>(options());
  failToCreate();
  handler.begun.wait();
  std::promise<bool> wasOver;
  host->queues()->createQueue()->dispatch([&] {
    host.reset();
    wasOver.set_value(handler.isOver);
  });
  std::this_thread::sleep_for(std::chrono::milliseconds(20));
  handler.release.countDown();
  EXPECT_TRUE(wasOver.get_future().get());
  const RootLock behindTheHost(directory.path());
}

TEST_F(HostIncidents, HaveTheDestructorWaitForNoLongerThanItsPatience) {
  const auto threads = std::make_shared<ThreadQueueFactory>();
  Latch begun(1);
  Latch release(1);
  onIncident = [&](const Incident&) {
    begun.countDown();
    release.wait();
  };
  HostOptions impatient = options(threads);
  impatient.shutDownPatience = std::chrono::seconds(0);
  host = std::make_unique<Host>(std::move(impatient));
  failToCreate();
  begun.wait();
  host.reset();
  EXPECT_THAT(log.messages(), ElementsAre("Host destroyed in the middle of a call of its incident handler."));
  release.countDown();
  EXPECT_TRUE(threads->drain(kLongPatience));
}

TEST_F(HostIncidents, AreToldToAHandlerThatMayDestroyTheHost) {
  onIncident = [&](const Incident&) { host.reset(); };
  start();
  failToCreate();
  failToCreate();
  queues->runAll();
  EXPECT_EQ(host, nullptr);
  EXPECT_THAT(told, SizeIs(1));
  EXPECT_THAT(log.messages(), IsEmpty());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
