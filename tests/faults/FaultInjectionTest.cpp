// A scripted life of the system with one call after the other failing: each sweep runs it once for every n, and the
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
#include <utility>

#include "faults/Life.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

constexpr unsigned int kPatience = 60;  // seconds for one life

std::size_t openDescriptors() {
  const std::filesystem::directory_iterator descriptors("/proc/self/fd");
  return static_cast<std::size_t>(std::distance(begin(descriptors), end(descriptors)));
}

#if defined(__SANITIZE_ADDRESS__) || defined(__SANITIZE_THREAD__)
constexpr std::size_t kStrides = 4;  // a life takes several times as long there
#else
constexpr std::size_t kStrides = 1;
#endif

// What is to fail in a life, and how often.
struct Faults {
  std::string name;
  std::function<void(Life& life, std::size_t n)> plan;
  std::size_t stride = 1;  // how many n it goes on by, to be done in seconds; CELLAR_EVERY_FAULT=1 leaves none out
  // Whether the n-th fault of that life must have been noticed by somebody; by nobody when absent.
  std::function<bool(Life& life, std::size_t n)> isDueToBeTold;
  Life::Hardship hardship = Life::Hardship::OneFault;
};

// The lives that met a fault in one and the same statement or file operation.
struct Place {
  std::size_t lives = 0;
  std::size_t livesWithDiscards = 0;  // that had a store discarded
};
using Places = std::map<std::string, Place>;

// A statement that changes the manifest, by its first word.
bool isWrite(const std::string& place) { return place == "INSERT" || place == "UPDATE" || place == "DELETE"; }

class FaultInjection : public testing::Test {
 protected:
  // Lives one life after the other, with the n-th call failing in the n-th, until one meets no fault.
  void sweep(const Faults& faults) {
    const std::size_t descriptors = openDescriptors();
    std::size_t met = 0;
    std::size_t lives = 0;
    Places places;
    const std::size_t stride = std::getenv("CELLAR_EVERY_FAULT") != nullptr ? 1 : faults.stride * kStrides;
    for (std::size_t n = 1; !HasFailure(); n += stride) {
      const testing::ScopedTrace trace(__FILE__, __LINE__, faults.name + ", n = " + std::to_string(n));
      const std::size_t metNow = live(faults, n, places);
      met += metNow;
      ++lives;
      if (metNow == 0) break;
    }
    EXPECT_GT(met, 0U);
    EXPECT_EQ(openDescriptors(), descriptors);
    std::cout << faults.name << ": " << met << " faults in " << lives << " lives\n";
    RecordProperty("faults", std::to_string(met));
    if (faults.hardship != Life::Hardship::ManyFaults) lookAt(places, faults.hardship);
  }

  // Only where the manifest is written may one fault cost a store; or where SQLite was shown damage.
  static void lookAt(const Places& places, Life::Hardship hardship) {
    for (const auto& [name, place] : places) {
      std::cout << "  in " << name << ": " << place.livesWithDiscards << " of " << place.lives
                << " lives had a store discarded\n";
      if (isWrite(name) || hardship == Life::Hardship::SilentLoss) continue;
      EXPECT_EQ(place.livesWithDiscards, 0U) << name;
    }
  }

  // Where the one fault of a life was met: the name of the file operation, or the first word of the statement.
  static std::string placeOf(const Life& life, std::size_t n) {
    const bool isFile = life.files->failures() > 0;
    const std::string text = isFile ? life.files->trace().at(n - 1) : life.vfs.statementOfLastFailure();
    return text.empty() ? "no statement" : text.substr(0, text.find(' '));
  }

  // The number of faults met.
  static std::size_t live(const Faults& faults, std::size_t n, Places& places) {
    const Watchdog watchdog(kPatience);
    const TemporaryDirectory directory(quickPlace());
    Life life(directory.path(), faults.hardship);
    faults.plan(life, n);
    for (std::size_t step = 0; step < Life::stepCount() && !HasFailure(); ++step) life.step(step);
    const std::size_t met = life.vfs.failures() + life.files->failures();
    const bool mustTell = met > 0 && faults.isDueToBeTold && faults.isDueToBeTold(life, n);
    EXPECT_TRUE(!mustTell || life.hasToldOfTrouble());
    EXPECT_TRUE(met > 0 || !life.hasToldOfTrouble());
    if (!HasFailure()) life.verify();
    life.end();
    if (met == 1) {
      Place& place = places[placeOf(life, n)];
      ++place.lives;
      if (life.discards() > 0) ++place.livesWithDiscards;
    }
    return met;
  }

  void sweepFiles(const std::string& name, int errnoCode, bool tears, std::size_t stride) {
    Faults faults;
    faults.name = name;
    faults.stride = stride;
    faults.plan = [=](Life& life, std::size_t n) {
      life.files->failNth(n, errnoCode);
      life.files->tearFailingWrites(tears);
    };
    // A query that fails answers false, or nothing, and work goes on from there.
    faults.isDueToBeTold = [](Life& life, std::size_t n) {
      const std::string call = life.files->trace().at(n - 1);
      const auto isCallOf = [&](const char* operation) { return call.rfind(operation, 0) == 0; };
      return !isCallOf("pathExists") && !isCallOf("is") && !isCallOf("listOtherEntries");
    };
    sweep(faults);
  }
};

TEST_F(FaultInjection, TheLifeItselfMeetsNoTrouble) {
  Faults none;
  none.plan = [](Life&, std::size_t) {};
  Places places;
  EXPECT_EQ(live(none, 1, places), 0U);
}

TEST_F(FaultInjection, AFileOperationThatFailsOnce) { sweepFiles("file operation, EIO", EIO, false, 1); }

TEST_F(FaultInjection, AFileOperationThatFindsNoSpaceOnceAndWritesTorn) {
  sweepFiles("file operation, ENOSPC, torn", ENOSPC, true, 3);
}

// From the n-th file operation on the disk takes nothing more, from nobody.
TEST_F(FaultInjection, ADiskThatIsFullFromOneMomentOn) {
  Faults faults;
  faults.name = "a full disk from the n-th file operation on";
  faults.stride = 11;
  faults.hardship = Life::Hardship::ManyFaults;
  faults.plan = [](Life& life, std::size_t n) {
    life.files->tearFailingWrites(true);
    life.vfs.tearFailingWrites(true);
    life.files->onCall = [&life, left = n](Operation, const std::string&) mutable {
      if (left == 0 || --left > 0) return;
      life.files->failAlways(Operation::WriteFile, ENOSPC);
      life.files->failAlways(Operation::CreateDirectory, ENOSPC);
      life.vfs.failFromNth(VfsCall::Write, 1, SQLITE_FULL);
    };
  };
  sweep(faults);
}

TEST_F(FaultInjection, ADiskThatIsDeadFromOneMomentOn) {
  Faults faults;
  faults.name = "a dead disk from the n-th file operation on";
  faults.stride = 11;
  faults.hardship = Life::Hardship::ManyFaults;
  faults.plan = [](Life& life, std::size_t n) {
    life.files->onCall = [&life, left = n](Operation, const std::string&) mutable {
      if (left == 0 || --left > 0) return;
      for (const Operation operation :
           {Operation::ReadFile, Operation::WriteFile, Operation::DeleteFile, Operation::RecursiverDirectoryDelete,
            Operation::Rename, Operation::CreateDirectory, Operation::GetDiskSpace, Operation::ListDirectories,
            Operation::ListDirectory}) {
        life.files->failAlways(operation, EIO);
      }
      for (const auto& [call, code] :
           {std::pair(VfsCall::Read, SQLITE_IOERR_READ), std::pair(VfsCall::Write, SQLITE_IOERR_WRITE),
            std::pair(VfsCall::Sync, SQLITE_IOERR_FSYNC), std::pair(VfsCall::Open, SQLITE_CANTOPEN)}) {
        life.vfs.failFromNth(call, 1, code);
      }
    };
  };
  sweep(faults);
}

// No manifest can be opened from one step on, for one step or for several, as when descriptors or rights are missing.
TEST_F(FaultInjection, AManifestThatCannotBeOpenedForAWhileCostsNothing) {
  const std::size_t last = Life::stepCount() - 1;
  std::size_t met = 0;
  for (std::size_t first = 0; first <= last && !HasFailure(); ++first) {
    for (const std::size_t length : {std::size_t{1}, std::size_t{2}, std::size_t{3}}) {
      const testing::ScopedTrace trace(__FILE__, __LINE__,
                                       std::to_string(length) + " from step " + std::to_string(first));
      const Watchdog watchdog(kPatience);
      const TemporaryDirectory directory(quickPlace());
      Life life(directory.path(), Life::Hardship::ManifestClosed);
      for (std::size_t step = 0; step <= last && !HasFailure(); ++step) {
        if (step == first) life.vfs.failFromNth(VfsCall::Open, 1, SQLITE_CANTOPEN);
        life.step(step);
        if (step + 1 == first + length) life.vfs.heal();
      }
      if (!HasFailure()) life.verify();
      EXPECT_EQ(life.discards(), 0U);
      met += life.vfs.failures();
    }
  }
  EXPECT_GT(met, 0U);
  std::cout << "manifests that cannot be opened for a while: " << met << " faults\n";
}

// What a purge leaves when it cannot take the old manifest away must not undo what is acknowledged after it.
TEST_F(FaultInjection, AManifestThatCannotBeWrittenBesideATrashThatTakesNothing) {
  Faults faults;
  faults.name = "no writing and no collecting from the n-th file operation on";
  faults.stride = 11;
  faults.hardship = Life::Hardship::ManyFaults;
  faults.plan = [](Life& life, std::size_t n) {
    life.files->onCall = [&life, left = n](Operation, const std::string&) mutable {
      if (left == 0 || --left > 0) return;
      life.files->failAlways(Operation::Rename, EIO);
      life.vfs.failFromNth(VfsCall::Write, 1, SQLITE_FULL);
    };
  };
  sweep(faults);
}

struct DatabaseFault {
  const char* name;
  VfsCall call;
  int code;
  std::size_t stride;
  bool tears;
};

void PrintTo(const DatabaseFault& fault, std::ostream* out) { *out << fault.name; }

class DatabaseFaultInjection : public FaultInjection, public testing::WithParamInterface<DatabaseFault> {};

TEST_P(DatabaseFaultInjection, ACallThatFailsOnce) {
  const DatabaseFault& fault = GetParam();
  Faults faults;
  faults.name = fault.name;
  faults.stride = fault.stride;
  if (fault.code == SQLITE_IOERR_SHORT_READ) faults.hardship = Life::Hardship::SilentLoss;
  faults.plan = [&](Life& life, std::size_t n) {
    life.vfs.failNth(fault.call, n, fault.code);
    life.vfs.tearFailingWrites(fault.tears);
  };
  sweep(faults);
}

INSTANTIATE_TEST_SUITE_P(
    SQLite, DatabaseFaultInjection,
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
                    DatabaseFault{"LockSharedMemoryFails", VfsCall::LockSharedMemory, SQLITE_IOERR_SHMLOCK, 7, false}),
    [](const auto& fault) { return fault.param.name; });

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
