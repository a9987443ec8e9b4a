// A scripted workload with one call after the other failing: each sweep runs it once for every n, and the
// n-th call of its kind fails, until a run meets no fault.

#include <gtest/gtest.h>
#include <sqlite3.h>

#include <algorithm>
#include <cerrno>
#include <cstddef>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <iostream>
#include <map>
#include <ostream>
#include <string>
#include <tuple>
#include <utility>

#include "faults/ScriptedWorkload.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

constexpr unsigned int kPatience = 60;  // seconds for one run

std::size_t openDescriptors() {
  const std::filesystem::directory_iterator descriptors("/proc/self/fd");
  return static_cast<std::size_t>(std::distance(begin(descriptors), end(descriptors)));
}

#if defined(CELLAR_RUNS_SLOWLY)
constexpr std::size_t kStrides = 4;  // a run takes several times as long there
#else
constexpr std::size_t kStrides = 1;
#endif

// What fails in a run of the workload, and how often.
struct Faults {
  std::string name;
  std::function<void(ScriptedWorkload& workload, std::size_t n)> plan;
  std::size_t stride = 1;  // how many n it goes on by, to be done in seconds; CELLAR_EVERY_FAULT=1 leaves none out
  // Whether the n-th fault must have been reported; if absent, none must be.
  std::function<bool(ScriptedWorkload& workload, std::size_t n)> mustBeReported;
  ScriptedWorkload::FaultMode mode = ScriptedWorkload::FaultMode::OneFault;
};

// The runs with a fault in the same statement or file operation.
struct Place {
  std::size_t runs = 0;
  std::size_t runsWithDiscards = 0;  // that had a store discarded
};
using Places = std::map<std::string, Place>;

// A statement that changes the manifest, by its first word.
bool isWrite(const std::string& place) { return place == "INSERT" || place == "UPDATE" || place == "DELETE"; }

std::string nameOf(Durability durability) {
  return durability == Durability::Relaxed ? "Relaxed" : durability == Durability::Safe ? "Safe" : "Synced";
}

class FaultSweep : public testing::Test {
 protected:
  Durability durability = Durability::Relaxed;
  std::size_t runsWithSilentLoss = 0;

  // Runs the workload again and again, with the n-th call failing in the n-th run, until a run has no fault.
  void sweep(const Faults& faults) {
    const std::size_t descriptors = openDescriptors();
    std::size_t met = 0;
    std::size_t runs = 0;
    Places places;
    const std::size_t usual = faults.stride * kStrides * (durability == Durability::Relaxed ? 1 : 3);
    const std::size_t stride = std::getenv("CELLAR_EVERY_FAULT") != nullptr ? 1 : usual;
    for (std::size_t n = 1; !HasFailure(); n += stride) {
      const testing::ScopedTrace trace(__FILE__, __LINE__, faults.name + ", n = " + std::to_string(n));
      const std::size_t metNow = live(faults, n, places);
      met += metNow;
      ++runs;
      if (metNow == 0) break;
    }
    EXPECT_GT(met, 0U);
    EXPECT_EQ(openDescriptors(), descriptors);
    std::cout << faults.name << ": " << met << " faults in " << runs << " runs\n";
    if (faults.mode == ScriptedWorkload::FaultMode::SilentLoss) {
      std::cout << "  in " << runsWithSilentLoss << " runs values were missing of which SQLite had lost the rows\n";
      EXPECT_LE(runsWithSilentLoss, 2U);  // where it takes its log for shorter than it is
    }
    RecordProperty("faults", std::to_string(met));
    if (faults.mode != ScriptedWorkload::FaultMode::ManyFaults) lookAt(places, faults.mode);
  }

  // Only where the manifest is written may one fault cost a store; or where SQLite was shown damage.
  void lookAt(const Places& places, ScriptedWorkload::FaultMode mode) const {
    for (const auto& [name, place] : places) {
      std::cout << "  in " << name << ": " << place.runsWithDiscards << " of " << place.runs
                << " runs had a store discarded\n";
      const bool mayDiscard = isWrite(name) || mode == ScriptedWorkload::FaultMode::SilentLoss;
      if (mayDiscard && durability == Durability::Relaxed) continue;
      EXPECT_EQ(place.runsWithDiscards, 0U) << name;
    }
  }

  // Where the one fault of a run happened: the name of the file operation, or the first word of the statement.
  static std::string placeOf(const ScriptedWorkload& workload, std::size_t n) {
    const bool isFile = workload.files->failures() > 0;
    const std::string text = isFile ? workload.files->trace().at(n - 1) : workload.vfs.statementOfLastFailure();
    return text.empty() ? "no statement" : text.substr(0, text.find(' '));
  }

  // The number of faults met.
  std::size_t live(const Faults& faults, std::size_t n, Places& places) {
    const Watchdog watchdog(kPatience);
    const TemporaryDirectory directory(quickPlace());
    ScriptedWorkload workload(directory.path(), faults.mode, durability);
    faults.plan(workload, n);
    for (std::size_t step = 0; step < ScriptedWorkload::stepCount() && !HasFailure(); ++step) workload.step(step);
    const std::size_t met = workload.vfs.failures() + workload.files->failures();
    const bool isReportExpected = met > 0 && faults.mustBeReported && faults.mustBeReported(workload, n);
    EXPECT_TRUE(!isReportExpected || workload.hasReportedTrouble())
        << (workload.files->failures() > 0 ? workload.files->trace().at(n - 1) : "");
    EXPECT_TRUE(met > 0 || !workload.hasReportedTrouble());
    if (!HasFailure()) workload.verify();
    workload.end();
    if (workload.silentlyMissing() > 0) ++runsWithSilentLoss;
    if (met == 1) {
      Place& place = places[placeOf(workload, n)];
      ++place.runs;
      if (workload.discards() > 0) ++place.runsWithDiscards;
    }
    return met;
  }

  void sweepFiles(const std::string& name, int errnoCode, bool tears, std::size_t stride) {
    Faults faults;
    faults.name = name;
    faults.stride = stride;
    faults.plan = [=](ScriptedWorkload& workload, std::size_t n) {
      workload.files->failNth(n, errnoCode);
      workload.files->tearFailingWrites(tears);
    };
    // A query that fails answers false, or nothing, and work goes on from there.
    faults.mustBeReported = [this](ScriptedWorkload& workload, std::size_t n) {
      const std::string call = workload.files->trace().at(n - 1);
      const auto isCallOf = [&](const char* operation) { return call.rfind(operation, 0) == 0; };
      // Written and synced ahead for a write that is then dropped with its queue.
      if (durability == Durability::Synced && (isCallOf("createFile") || isCallOf("sync"))) return false;
      return !isCallOf("pathExists") && !isCallOf("is") && !isCallOf("listOtherEntries");
    };
    sweep(faults);
  }
};

class FaultInjection : public FaultSweep, public testing::WithParamInterface<Durability> {
 protected:
  FaultInjection() { durability = GetParam(); }
};

TEST_P(FaultInjection, TheLifeItselfMeetsNoTrouble) {
  Faults none;
  none.plan = [](ScriptedWorkload&, std::size_t) {};
  Places places;
  EXPECT_EQ(live(none, 1, places), 0U);
}

TEST_P(FaultInjection, AFileOperationThatFailsOnce) { sweepFiles("file operation, EIO", EIO, false, 1); }

TEST_P(FaultInjection, AFileOperationThatFindsNoSpaceOnceAndWritesTorn) {
  sweepFiles("file operation, ENOSPC, torn", ENOSPC, true, 3);
}

// From the n-th file operation on the disk takes nothing more, from nobody.
TEST_P(FaultInjection, ADiskThatIsFullFromOneMomentOn) {
  Faults faults;
  faults.name = "a full disk from the n-th file operation on";
  faults.stride = 11;
  faults.mode = ScriptedWorkload::FaultMode::ManyFaults;
  faults.plan = [](ScriptedWorkload& workload, std::size_t n) {
    workload.files->tearFailingWrites(true);
    workload.vfs.tearFailingWrites(true);
    workload.files->onCall = [&workload, left = n](Operation, const std::string&) mutable {
      if (left == 0 || --left > 0) return;
      workload.files->failAlways(Operation::WriteFile, ENOSPC);
      workload.files->failAlways(Operation::CreateDirectory, ENOSPC);
      workload.vfs.failFromNth(VfsCall::Write, 1, SQLITE_FULL);
    };
  };
  sweep(faults);
}

TEST_P(FaultInjection, ADiskThatIsDeadFromOneMomentOn) {
  Faults faults;
  faults.name = "a dead disk from the n-th file operation on";
  faults.stride = 11;
  faults.mode = ScriptedWorkload::FaultMode::ManyFaults;
  faults.plan = [](ScriptedWorkload& workload, std::size_t n) {
    workload.files->onCall = [&workload, left = n](Operation, const std::string&) mutable {
      if (left == 0 || --left > 0) return;
      for (const Operation operation :
           {Operation::ReadFile, Operation::WriteFile, Operation::DeleteFile, Operation::RecursiverDirectoryDelete,
            Operation::Rename, Operation::CreateDirectory, Operation::GetDiskSpace, Operation::ListDirectories,
            Operation::ListDirectory}) {
        workload.files->failAlways(operation, EIO);
      }
      for (const auto& [call, code] :
           {std::pair(VfsCall::Read, SQLITE_IOERR_READ), std::pair(VfsCall::Write, SQLITE_IOERR_WRITE),
            std::pair(VfsCall::Sync, SQLITE_IOERR_FSYNC), std::pair(VfsCall::Open, SQLITE_CANTOPEN)}) {
        workload.vfs.failFromNth(call, 1, code);
      }
    };
  };
  sweep(faults);
}

// No manifest can be opened from one step on, for one step or for several, as when descriptors or rights are missing.
TEST_P(FaultInjection, AManifestThatCannotBeOpenedForAWhileCostsNothing) {
  const std::size_t last = ScriptedWorkload::stepCount() - 1;
  std::size_t met = 0;
  for (std::size_t first = 0; first <= last && !HasFailure(); ++first) {
    for (const std::size_t length : {std::size_t{1}, std::size_t{2}, std::size_t{3}}) {
      const testing::ScopedTrace trace(__FILE__, __LINE__,
                                       std::to_string(length) + " from step " + std::to_string(first));
      const Watchdog watchdog(kPatience);
      const TemporaryDirectory directory(quickPlace());
      ScriptedWorkload workload(directory.path(), ScriptedWorkload::FaultMode::ManifestClosed, durability);
      for (std::size_t step = 0; step <= last && !HasFailure(); ++step) {
        if (step == first) workload.vfs.failFromNth(VfsCall::Open, 1, SQLITE_CANTOPEN);
        workload.step(step);
        if (step + 1 == first + length) workload.vfs.heal();
      }
      if (!HasFailure()) workload.verify();
      EXPECT_EQ(workload.discards(), 0U);
      met += workload.vfs.failures();
    }
  }
  EXPECT_GT(met, 0U);
  std::cout << "manifests that cannot be opened for a while: " << met << " faults\n";
}

// What a purge leaves when it cannot take the old manifest away must not undo what is acknowledged after it.
TEST_P(FaultInjection, AManifestThatCannotBeWrittenBesideATrashThatTakesNothing) {
  Faults faults;
  faults.name = "no writing and no collecting from the n-th file operation on";
  faults.stride = 11;
  faults.mode = ScriptedWorkload::FaultMode::ManyFaults;
  faults.plan = [](ScriptedWorkload& workload, std::size_t n) {
    workload.files->onCall = [&workload, left = n](Operation, const std::string&) mutable {
      if (left == 0 || --left > 0) return;
      workload.files->failAlways(Operation::Rename, EIO);
      workload.vfs.failFromNth(VfsCall::Write, 1, SQLITE_FULL);
    };
  };
  sweep(faults);
}

INSTANTIATE_TEST_SUITE_P(Files, FaultInjection,
                         testing::Values(Durability::Relaxed, Durability::Safe, Durability::Synced),
                         [](const auto& parameter) { return nameOf(parameter.param); });

struct DatabaseFault {
  const char* name;
  VfsCall call;
  int code;
  std::size_t stride;
  bool tears;
};

void PrintTo(const DatabaseFault& fault, std::ostream* out) { *out << fault.name; }

class DatabaseFaultInjection : public FaultSweep,
                               public testing::WithParamInterface<std::tuple<Durability, DatabaseFault>> {
 protected:
  DatabaseFaultInjection() { durability = std::get<0>(GetParam()); }
};

TEST_P(DatabaseFaultInjection, ACallThatFailsOnce) {
  const DatabaseFault& fault = std::get<1>(GetParam());
  Faults faults;
  faults.name = fault.name;
  faults.stride = fault.stride;
  if (fault.code == SQLITE_IOERR_SHORT_READ) faults.mode = ScriptedWorkload::FaultMode::SilentLoss;
  faults.plan = [&](ScriptedWorkload& workload, std::size_t n) {
    workload.vfs.failNth(fault.call, n, fault.code);
    workload.vfs.tearFailingWrites(fault.tears);
  };
  sweep(faults);
}

INSTANTIATE_TEST_SUITE_P(
    SQLite, DatabaseFaultInjection,
    testing::Combine(
        testing::Values(Durability::Relaxed, Durability::Safe),
        testing::Values(DatabaseFault{"OpenCannot", VfsCall::Open, SQLITE_CANTOPEN, 1, false},
                        DatabaseFault{"ReadFails", VfsCall::Read, SQLITE_IOERR_READ, 2, false},
                        DatabaseFault{"ReadIsShort", VfsCall::Read, SQLITE_IOERR_SHORT_READ, 2, false},
                        DatabaseFault{"WriteFails", VfsCall::Write, SQLITE_IOERR_WRITE, 7, false},
                        DatabaseFault{"WriteFindsNoSpaceAndIsTorn", VfsCall::Write, SQLITE_FULL, 7, true},
                        DatabaseFault{"TruncateFails", VfsCall::Truncate, SQLITE_IOERR_TRUNCATE, 1, false},
                        DatabaseFault{"SyncFails", VfsCall::Sync, SQLITE_IOERR_FSYNC, 1, false},
                        DatabaseFault{"FileSizeFails", VfsCall::FileSize, SQLITE_IOERR_FSTAT, 2, false},
                        DatabaseFault{"LockIsBusy", VfsCall::Lock, SQLITE_BUSY, 1, false},
                        DatabaseFault{"LockFails", VfsCall::Lock, SQLITE_IOERR_LOCK, 1, false},
                        DatabaseFault{"DeleteFails", VfsCall::Delete, SQLITE_IOERR_DELETE, 1, false},
                        DatabaseFault{"AccessFails", VfsCall::Access, SQLITE_IOERR_ACCESS, 1, false},
                        DatabaseFault{"MapSharedMemoryFails", VfsCall::MapSharedMemory, SQLITE_IOERR_SHMMAP, 1, false},
                        DatabaseFault{"LockSharedMemoryIsBusy", VfsCall::LockSharedMemory, SQLITE_BUSY, 7, false},
                        DatabaseFault{"LockSharedMemoryFails", VfsCall::LockSharedMemory, SQLITE_IOERR_SHMLOCK, 7,
                                      false})),
    [](const auto& parameter) { return nameOf(std::get<0>(parameter.param)) + std::get<1>(parameter.param).name; });

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
