// A scripted life of the system with one call after the other failing: each sweep runs it once for every n, and the
// n-th call of its kind fails, until a run meets no fault.

#include <gtest/gtest.h>
#include <sqlite3.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstddef>
#include <cstdlib>
#include <filesystem>
#include <functional>
#include <iostream>
#include <ostream>
#include <string>
#include <utility>

#include "faults/Life.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

constexpr unsigned int kPatience = 60;  // seconds for one life

// Thousands of lives: in memory where the machine has a place for that.
std::string quickPlace() {
  const char* const memory = "/dev/shm";
  return ::access(memory, W_OK | X_OK) == 0 ? memory : testing::TempDir();
}

std::size_t openDescriptors() {
  const std::filesystem::directory_iterator descriptors("/proc/self/fd");
  return static_cast<std::size_t>(std::distance(begin(descriptors), end(descriptors)));
}

// What is to fail in a life, and how often.
struct Faults {
  std::string name;
  std::function<void(Life& life, std::size_t n)> plan;
  std::size_t stride = 1;  // how many n it goes on by, to be done in seconds; CELLAR_EVERY_FAULT=1 leaves none out
  // Whether the n-th fault of that life must have been noticed by somebody; by nobody when absent.
  std::function<bool(Life& life, std::size_t n)> isDueToBeTold;
  Life::Hardship hardship = Life::Hardship::OneFault;
};

class FaultInjection : public testing::Test {
 protected:
  // Lives one life after the other, with the n-th call failing in the n-th, until one meets no fault.
  void sweep(const Faults& faults) {
    const std::size_t descriptors = openDescriptors();
    std::size_t met = 0;
    std::size_t lives = 0;
    const std::size_t stride = std::getenv("CELLAR_EVERY_FAULT") != nullptr ? 1 : faults.stride;
    for (std::size_t n = 1; !HasFailure(); n += stride) {
      const testing::ScopedTrace trace(__FILE__, __LINE__, faults.name + ", n = " + std::to_string(n));
      const std::size_t metNow = live(faults, n);
      met += metNow;
      ++lives;
      if (metNow == 0) break;
    }
    EXPECT_GT(met, 0U);
    EXPECT_EQ(openDescriptors(), descriptors);
    std::cout << faults.name << ": " << met << " faults in " << lives << " lives\n";
    RecordProperty("faults", std::to_string(met));
  }

  // The number of faults met.
  static std::size_t live(const Faults& faults, std::size_t n) {
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
    // A query that fails answers false, and work goes on from there.
    faults.isDueToBeTold = [](Life& life, std::size_t n) {
      const std::string call = life.files->trace().at(n - 1);
      return call.rfind("pathExists", 0) != 0 && call.rfind("is", 0) != 0;
    };
    sweep(faults);
  }
};

TEST_F(FaultInjection, TheLifeItselfMeetsNoTrouble) {
  Faults none;
  none.plan = [](Life&, std::size_t) {};
  EXPECT_EQ(live(none, 1), 0U);
}

TEST_F(FaultInjection, AFileOperationThatFailsOnce) { sweepFiles("file operation, EIO", EIO, false, 1); }

TEST_F(FaultInjection, AFileOperationThatFindsNoSpaceOnceAndWritesTorn) {
  sweepFiles("file operation, ENOSPC, torn", ENOSPC, true, 2);
}

// From the n-th file operation on the disk takes nothing more, from nobody.
TEST_F(FaultInjection, ADiskThatIsFullFromOneMomentOn) {
  Faults faults;
  faults.name = "a full disk from the n-th file operation on";
  faults.stride = 7;
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
  faults.stride = 7;
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
                    DatabaseFault{"ReadFails", VfsCall::Read, SQLITE_IOERR_READ, 1, false},
                    DatabaseFault{"ReadIsShort", VfsCall::Read, SQLITE_IOERR_SHORT_READ, 1, false},
                    DatabaseFault{"WriteFails", VfsCall::Write, SQLITE_IOERR_WRITE, 7, false},
                    DatabaseFault{"WriteFindsNoSpaceAndIsTorn", VfsCall::Write, SQLITE_FULL, 7, true},
                    DatabaseFault{"TruncateFails", VfsCall::Truncate, SQLITE_IOERR_TRUNCATE, 1, false},
                    DatabaseFault{"SyncFails", VfsCall::Sync, SQLITE_IOERR_FSYNC, 1, false},
                    DatabaseFault{"FileSizeFails", VfsCall::FileSize, SQLITE_IOERR_FSTAT, 1, false},
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
