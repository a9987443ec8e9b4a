// The scripted workload on a small disk of its own that something else fills to the last byte.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sched.h>
#include <sys/mount.h>
#include <unistd.h>

#include <fcntl.h>
#include <cerrno>
#include <cstddef>
#include <cstring>
#include <string>
#include <vector>

#include "faults/ScriptedWorkload.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar::test {
namespace {

// A disk in memory, seen by this process alone. Gone with the object.
class SmallDisk {
 public:
  explicit SmallDisk(const std::string& path) : path_(path), whyNot_(mountOn(path)) {}
  SmallDisk(const SmallDisk&) = delete;
  SmallDisk& operator=(const SmallDisk&) = delete;
  ~SmallDisk() {
    if (whyNot_.empty()) (void)::umount2(path_.c_str(), MNT_DETACH);
  }

  // Why there is none; "" when there is one.
  const std::string& whyNot() const { return whyNot_; }

  // Takes all the room that is left.
  void fill() const {
    const int file = ::open(filler().c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0600);
    ASSERT_NE(file, -1) << std::strerror(errno);
    for (std::size_t piece = 65536; piece > 0; piece /= 2) {
      const std::vector<char> bytes(piece, 'x');
      while (::write(file, bytes.data(), piece) > 0) continue;
      EXPECT_EQ(errno, ENOSPC);
    }
    (void)::close(file);
  }

  void makeRoom() const { EXPECT_EQ(::unlink(filler().c_str()), 0); }

 private:
  std::string filler() const { return path_ + "/filler"; }

  static std::string mountOn(const std::string& path) {
    // A mount namespace of its own, so that nothing stays behind whatever becomes of this process.
    if (::unshare(CLONE_NEWNS) != 0) return std::string("unshare: ") + std::strerror(errno);
    const bool isMounted = ::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0 &&
                           ::mount("none", path.c_str(), "tmpfs", 0, "size=2m") == 0;
    return isMounted ? "" : std::string("mount: ") + std::strerror(errno);
  }

  const std::string path_;
  const std::string whyNot_;  // "" when it is mounted
};

// Filled before each step in turn, for as long as one step or until the end.
void liveOnAFullDisk(std::size_t first, std::size_t last) {
  const Watchdog watchdog(60);
  const TemporaryDirectory directory;
  const SmallDisk disk(directory.path());
  if (!disk.whyNot().empty()) GTEST_SKIP() << "no disk can be mounted here: " << disk.whyNot();
  ScriptedWorkload workload(directory.file("root"), ScriptedWorkload::FaultMode::ManyFaults);
  for (std::size_t step = 0; step < ScriptedWorkload::stepCount(); ++step) {
    const testing::ScopedTrace trace(__FILE__, __LINE__, "full from step " + std::to_string(first));
    if (step == first) disk.fill();
    workload.isInTrouble = step >= first && step <= last;
    workload.step(step);
    if (step == last) disk.makeRoom();
  }
  workload.isInTrouble = false;
  workload.verify();
  workload.end();
}

TEST(FullDisk, FilledBeforeAnyStepCostsNothingThatIsNotDescribedOnceThereIsRoom) {
  for (std::size_t step = 0; step < ScriptedWorkload::stepCount() && !testing::Test::IsSkipped(); ++step) {
    liveOnAFullDisk(step, step);
  }
}

TEST(FullDisk, FilledBeforeAnyStepUntilTheEndIsForgottenOnceThereIsRoom) {
  for (std::size_t step = 0; step < ScriptedWorkload::stepCount() && !testing::Test::IsSkipped(); ++step) {
    liveOnAFullDisk(step, ScriptedWorkload::stepCount() - 1);
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::test
