// Kills an application in the midst of its work, again and again, and looks each time at what it finds.
// usage: cellar_crash KILLS [SEED [DIRECTORY]]
#include <glog/logging.h>
#include <poll.h>
#include <sys/wait.h>
#include <unistd.h>

#include <array>
#include <cerrno>
#include <chrono>
#include <csignal>
#include <cstdint>
#include <cstdlib>
#include <filesystem>
#include <iomanip>
#include <iostream>
#include <random>
#include <stdexcept>
#include <string>
#include <system_error>

#include "crash/Inspection.h"
#include "crash/Ledger.h"
#include "crash/Protocol.h"
#include "crash/Worker.h"

namespace velmora::mobile::xplat::cellar::crash {

namespace {

using Clock = std::chrono::steady_clock;

constexpr std::size_t kKillsPerRoot = 50;  // then a new one: the first start on an empty place is killed too

[[noreturn]] void fail(const char* what) { throw std::system_error(errno, std::generic_category(), what); }

struct Child {
  pid_t process;
  int pipe;
};

Child start(const std::string& root, std::uint64_t seed, std::uint32_t firstVersion) {
  int ends[2];
  if (::pipe(ends) != 0) fail("pipe");
  const std::string seedText = std::to_string(seed);
  const std::string versionText = std::to_string(firstVersion);
  const std::string pipeText = std::to_string(ends[1]);
  const pid_t process = ::fork();
  if (process < 0) fail("fork");
  if (process == 0) {
    (void)::close(ends[0]);
    (void)::execl("/proc/self/exe", "cellar_crash", "--work", root.c_str(), seedText.c_str(), versionText.c_str(),
                  pipeText.c_str(), nullptr);
    std::_Exit(127);
  }
  (void)::close(ends[1]);
  return {process, ends[0]};
}

// Takes in what the worker tells until the moment has come, or, without one, until the pipe has closed. A moment that
// counts from the worker's readiness begins anew with it.
void listen(int pipe, std::optional<Clock::time_point> moment, std::optional<Clock::duration> afterReady,
            Ledger& ledger) {
  Record record{};
  std::size_t have = 0;
  while (true) {
    int patience = -1;
    if (moment) {
      const auto left = std::chrono::ceil<std::chrono::milliseconds>(*moment - Clock::now()).count();
      if (left <= 0) return;
      patience = static_cast<int>(left);
    }
    pollfd wanted{pipe, POLLIN, 0};
    const int ready = ::poll(&wanted, 1, patience);
    if (ready <= 0) continue;
    const ssize_t count = ::read(pipe, reinterpret_cast<char*>(&record) + have, sizeof record - have);
    if (count <= 0) return;
    have += static_cast<std::size_t>(count);
    if (have < sizeof record) continue;
    have = 0;
    if (record.kind == Record::Kind::Ready && afterReady) moment = Clock::now() + *afterReady;
    ledger.note(record);
  }
}

class Killer {
 public:
  Killer(std::uint64_t seed, std::string place) : random_(seed), place_(std::move(place)) {}

  void killOnce() {
    if (kills_ % kKillsPerRoot == 0) changeRoot();
    const Child child = start(root_, random_(), ledger_.lastVersion());
    // One in four while it is still opening its stores, the others at work.
    const bool isEarly = random_() % 4 == 0;
    const auto delay = std::chrono::microseconds(random_() % (isEarly ? 30000 : 60000));
    const auto limit = isEarly ? delay : std::chrono::microseconds(std::chrono::seconds(60));
    listen(child.pipe, Clock::now() + limit, isEarly ? std::nullopt : std::optional<Clock::duration>(delay), ledger_);
    (void)::kill(child.process, SIGKILL);
    listen(child.pipe, std::nullopt, std::nullopt, ledger_);
    (void)::close(child.pipe);
    int status = 0;
    if (::waitpid(child.process, &status, 0) != child.process) fail("waitpid");
    if (!WIFSIGNALED(status) || WTERMSIG(status) != SIGKILL) {
      findings_.faults.push_back("the worker ended by itself, status " + std::to_string(status));
    }
    ++kills_;
    const std::size_t orphansBefore = std::exchange(findings_.orphans, 0);
    inspect(root_, ledger_, findings_);
    orphansOfRoot_ = std::exchange(findings_.orphans, orphansBefore);
  }

  void finish() {
    findings_.orphans += orphansOfRoot_;
    acknowledged_ += ledger_.acknowledged;
    failed_ += ledger_.failed;
    if (findings_.faults.empty()) std::filesystem::remove_all(root_);
  }

  std::size_t kills() const { return kills_; }
  const Findings& findings() const { return findings_; }
  std::size_t acknowledged() const { return acknowledged_; }
  std::size_t failed() const { return failed_; }
  const std::string& root() const { return root_; }

 private:
  void changeRoot() {
    if (!root_.empty()) finish();
    orphansOfRoot_ = 0;
    ledger_ = Ledger();
    root_ = (std::filesystem::path(place_) / "cellar-crash-XXXXXX").string();
    if (::mkdtemp(root_.data()) == nullptr) fail("mkdtemp");
  }

  std::mt19937_64 random_;
  const std::string place_;
  std::string root_;
  Ledger ledger_;
  Findings findings_;
  std::size_t kills_ = 0;
  std::size_t orphansOfRoot_ = 0;
  std::size_t acknowledged_ = 0;
  std::size_t failed_ = 0;
};

int conclude(const Killer& killer, std::uint64_t seed, double seconds) {
  const Findings& findings = killer.findings();
  static constexpr std::array<const char*, kOutcomes> names = {"old",   "new",     "partly written", "older",
                                                               "error", "missing", "forbidden"};
  std::cout << "seed " << seed << ": " << killer.kills() << " kills in " << std::fixed << std::setprecision(1)
            << seconds << " s, " << static_cast<double>(killer.kills()) / seconds << " a second\n"
            << killer.acknowledged() << " operations acknowledged, " << killer.failed() << " failed\n"
            << findings.intact << " values as they were acknowledged, " << findings.evicted
            << " evicted or never stored\ncaught in the middle:";
  for (std::size_t i = 0; i < names.size(); ++i) std::cout << " " << findings.middle.at(i) << " " << names.at(i);
  std::cout << "\n" << findings.orphans << " files without a record left behind\n";
  for (const std::string& fault : findings.faults) std::cout << "BROKEN: " << fault << "\n";
  if (!findings.faults.empty()) {
    std::cout << "The last root stays: " << killer.root() << "\nFAILED: " << findings.faults.size()
              << " broken promises\n";
    return 1;
  }
  std::cout << "PASSED: every promise was kept\n";
  return 0;
}

int killAgainAndAgain(std::size_t kills, std::uint64_t seed, const std::string& place) {
  const auto begin = Clock::now();
  Killer killer(seed, place);
  const std::size_t step = std::max<std::size_t>(kills / 10, 1);
  while (killer.kills() < kills && killer.findings().faults.empty()) {
    killer.killOnce();
    if (killer.kills() % step == 0) std::cout << killer.kills() << " of " << kills << " kills" << std::endl;
  }
  killer.finish();
  return conclude(killer, seed, std::chrono::duration<double>(Clock::now() - begin).count());
}

// In memory where the machine has a place for that: a killed process loses nothing that it has written.
std::string defaultPlace() {
  return ::access("/dev/shm", W_OK | X_OK) == 0 ? "/dev/shm" : std::filesystem::temp_directory_path().string();
}

int run(const std::vector<std::string>& arguments) {
  if (arguments.size() == 5 && arguments[0] == "--work") {
    work(arguments[1], std::stoull(arguments[2]), static_cast<std::uint32_t>(std::stoul(arguments[3])),
         std::stoi(arguments[4]));
    return 3;
  }
  if (arguments.empty() || arguments.size() > 3) throw std::invalid_argument("KILLS [SEED [DIRECTORY]]");
  const std::uint64_t seed = arguments.size() > 1 ? std::stoull(arguments[1]) : std::random_device()();
  return killAgainAndAgain(std::stoul(arguments[0]), seed, arguments.size() > 2 ? arguments[2] : defaultPlace());
}

}  // namespace

}  // namespace velmora::mobile::xplat::cellar::crash

// What the stores log is looked at, not shown and not kept.
static void muteLog(const char* program) {
  for (google::LogSeverity severity = google::GLOG_INFO; severity < google::NUM_SEVERITIES; ++severity) {
    google::SetLogDestination(severity, "");
  }
  google::SetStderrLogging(google::GLOG_FATAL);
  google::InitGoogleLogging(program);
}

int main(int argc, char** argv) {
  muteLog(argv[0]);
  try {
    return velmora::mobile::xplat::cellar::crash::run({argv + 1, argv + argc});
  } catch (const std::exception& error) {
    std::cerr << "cellar_crash: " << error.what() << "\n";
    return 2;
  }
}
