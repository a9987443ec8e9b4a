#pragma once

#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "Durability.h"
#include "host/testing/ManualClock.h"
#include "support/FaultyVfs.h"
#include "support/KeyValueStoreFixture.h"
#include "support/LogCapture.h"
#include "support/ManagerServices.h"
#include "support/ShortPauses.h"

namespace velmora::mobile::xplat::cellar::test {

// What a fetch of a key may return, by the operations so far and their results.
struct Remembered {
  std::set<std::string> values;       // any of these, whole
  std::set<std::string> everWritten;  // every value that was stored or attempted
  bool mayBeMissing = true;
  bool mayFail = false;  // a record whose file could not be written, and that could not be rolled back
  bool mayBeTorn = false;
};

// A directory for thousands of runs: in memory, if the machine has such a place.
std::string quickPlace();

// A scripted workload on an application's storage, from its configuration to its end and a restart, on queues that run
// when the script says so. It records what was acknowledged, and checks that the stores keep it: each step, each fetch
// in it and `verify` are test assertions. Files and databases can be made to fail meanwhile.
class ScriptedWorkload {
 public:
  enum class FaultMode {
    OneFault,
    ManyFaults,      // so that what a failure has left cannot always be removed
    ManifestClosed,  // it cannot be opened for a while: a write that fails has changed nothing
    SilentLoss,      // the database is cut short under SQLite: values may vanish without a word, but none may be wrong
  };

  // Under `root`, with stores of that durability: of safe ones no value may be lost, whatever fails, and none is
  // discarded. Only of what SQLite has not been shown values may vanish, which is counted.
  ScriptedWorkload(const std::string& root, FaultMode mode, Durability durability = Durability::Relaxed);
  ScriptedWorkload(const ScriptedWorkload&) = delete;
  ScriptedWorkload& operator=(const ScriptedWorkload&) = delete;
  ~ScriptedWorkload();

  static std::size_t stepCount();

  // Runs one step of the script; they come in order.
  void step(std::size_t number);

  // Call it when the faults are over: everything that was recorded is there, in this process if it still runs, and
  // after a restart, and new work succeeds.
  void verify();

  // Ends the use of the storage, like the end of the process.
  void end();

  // Whether a failure was reported: to a caller by an exception or a future, or in the log.
  bool hasReportedTrouble() const;

  // How many times so far a store has been discarded for its manifest.
  std::size_t discards() const;

  // How many fetches so far have missed a value that SQLite has lost without knowing.
  std::size_t silentlyMissing() const { return silentlyMissing_; }

  bool isInTrouble = false;  // by a fault that neither of the two below knows of
  FaultyVfs vfs;
  std::shared_ptr<DiskOfChosenSize> files = std::make_shared<DiskOfChosenSize>();

 private:
  struct Process;
  using Keys = std::map<std::string, Remembered>;
  struct Step;

  static const std::vector<Step>& script();

  void start();
  void restart();
  void fill();
  void fetchSome();
  void overwrite();
  void remove();
  void evict();
  void prune();
  void expire();
  void clear();
  void measure();
  void flush();
  void emptyTrash();
  void survive();
  void markForTrash();
  void invalidate();
  void fetchAll();
  void fillAgain();
  void changeAtOnce();
  void closeInTheMiddle();
  void letGoInTheMiddle();

  struct Asked;

  void put(const std::string& store, const std::string& key, int version);
  Asked ask(const std::string& store, const std::string& key, int version);
  std::vector<Asked> askForMany(int version);
  void take(const Asked& asked);
  void forget(const Asked& asked);
  void fetch(const std::string& store, const std::string& key);
  void drop(const std::string& store, const std::string& key);
  void expectNewWorkSucceeds();
  void expectDatabasesAreSound();
  void expectEachPurgeIsReported() const;
  void expectAllIsAnswered(const std::string& store, const std::string& key, const std::string& answer);

  bool has(const std::string& store) const;
  PersistentKeyValueStore& store(const std::string& name) const;
  std::size_t purges(const std::string& store) const;
  std::size_t purgeLines(const std::string& beginning) const;
  void notePurges();
  void mayGo(const std::string& store);
  void attempt(const std::function<void()>& work);
  void settle();
  bool runNext(ManualExecutor& queue);
  void runAll(ManualExecutor& queue);
  std::size_t faults() const;

  const std::string root_;
  const FaultMode mode_;
  const Durability durability_;
  const bool isSafe_;
  ManualClock clock_{2'000'000'000};
  ShortPauses pauses_;
  LogCapture log_;
  std::map<std::string, Keys> memory_;                   // by store
  std::map<std::string, std::size_t> purges_;            // of this process, by store
  std::map<std::string, std::size_t> linesBeforeStart_;  // that reported a purge, by store
  std::size_t complaints_ = 0;                           // exceptions and failed futures
  std::size_t silentlyMissing_ = 0;
  bool mayThrow_ = false;  // a manifest is being loaded: its task passes on what is not damage
  int freshVersion_ = 100;
  std::unique_ptr<Process> process_;
};

}  // namespace velmora::mobile::xplat::cellar::test
