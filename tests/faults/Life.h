#pragma once

#include <cstddef>
#include <functional>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <vector>

#include "host/testing/ManualClock.h"
#include "support/FaultyVfs.h"
#include "support/KeyValueStoreFixture.h"
#include "support/LogCapture.h"
#include "support/ManagerServices.h"
#include "support/ShortPauses.h"

namespace velmora::mobile::xplat::cellar::test {

// What may be found under a key, by what was asked for and what was answered.
struct Remembered {
  std::set<std::string> values;       // any of these, whole
  std::set<std::string> everWritten;  // what it ever held or was to hold
  bool mayBeMissing = true;
  bool mayFail = false;  // a record whose file could not be written, and which could not be taken back
  bool mayBeTorn = false;
};

// Where thousands of lives can be lived: in memory, where the machine has a place for that.
std::string quickPlace();

// A scripted life of an application's storage, from its configuration to its end and back, on queues that run when the
// script says so. It remembers what it was promised, and holds the stores to it: each step, each fetch in it and
// `verify` are test assertions. Files and databases may be made to fail meanwhile.
class Life {
 public:
  enum class Hardship {
    OneFault,
    ManyFaults,      // so that what a failure has left cannot always be taken away
    ManifestClosed,  // it cannot be opened for a while: a write that fails has changed nothing
    SilentLoss,      // the database is cut short under SQLite: values may vanish without a word, but none may be wrong
  };

  // Under `root`.
  Life(const std::string& root, Hardship hardship);
  Life(const Life&) = delete;
  Life& operator=(const Life&) = delete;
  ~Life();

  static std::size_t stepCount();

  // Runs one step of the script; they come in order.
  void step(std::size_t number);

  // The faults are over: everything that is remembered is there, in this run of the process if it can be asked, and
  // after a restart, and new work succeeds.
  void verify();

  // Nothing is asked of the storage of this run any more, as when the process ends.
  void end();

  // Whether anybody was told that something went wrong: a caller by an exception or a future, or the log.
  bool hasToldOfTrouble() const;

  // How many times so far a store has been discarded for its manifest.
  std::size_t discards() const;

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
  void expectEachPurgeIsTold() const;
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
  const Hardship hardship_;
  ManualClock clock_{2'000'000'000};
  ShortPauses pauses_;
  LogCapture log_;
  std::map<std::string, Keys> memory_;                   // by store
  std::map<std::string, std::size_t> purges_;            // of this process, by store
  std::map<std::string, std::size_t> linesBeforeStart_;  // that told of a purge, by store
  std::size_t complaints_ = 0;                           // exceptions and failed futures
  bool mayThrow_ = false;  // a manifest is being loaded: its task passes on what is not damage
  int freshVersion_ = 100;
  std::unique_ptr<Process> process_;
};

}  // namespace velmora::mobile::xplat::cellar::test
