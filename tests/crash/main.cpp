// Kills an application in the midst of its work, or has it close, again and again, and looks each time at what it
// finds. usage: cellar_crash [--safe] [--close] TIMES [SEED [DIRECTORY]]
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

constexpr std::size_t kEndingsPerRoot = 50;    // then a new one: the first start on an empty place is ended too
constexpr std::chrono::seconds kPatience(60);  // that a worker has for closing

[[noreturn]] void fail(const char* what) { throw std::system_error(errno, std::generic_category(), what); }

struct Child {
  pid_t process;
  int pipe;     // from it
  int control;  // to it
};

[[noreturn]] void execute(const Task& task) {
  const std::array<std::string, 6> words = {task.root,
                                            std::to_string(task.seed),
                                            std::to_string(task.firstVersion),
                                            std::to_string(static_cast<int>(task.ending)),
                                            std::to_string(task.pipe),
                                            std::to_string(task.control)};
  (void)::execl("/proc/self/exe", "cellar_crash", "--work", words[0].c_str(), words[1].c_str(), words[2].c_str(),
                words[3].c_str(), words[4].c_str(), words[5].c_str(), nullptr);
  std::_Exit(127);
}

Child start(Task task) {
  int fromChild[2];
  int toChild[2];
  if (::pipe(fromChild) != 0 || ::pipe(toChild) != 0) fail("pipe");
  task.pipe = fromChild[1];
  task.control = toChild[0];
  const pid_t process = ::fork();
  if (process < 0) fail("fork");
  if (process == 0) {
    (void)::close(fromChild[0]);
    (void)::close(toChild[1]);
    execute(task);
  }
  (void)::close(fromChild[1]);
  (void)::close(toChild[0]);
  return {process, fromChild[0], toChild[1]};
}

// Takes in what the worker tells.
class Listener {
 public:
  Listener(int pipe, Ledger& ledger) : pipe_(pipe), ledger_(ledger) {}

  // Until the moment has come; false when the pipe has closed before. A moment that counts from the worker's readiness
  // begins anew with it.
  bool until(Clock::time_point moment, std::optional<Clock::duration> afterReady = std::nullopt) {
    while (true) {
      const auto left = std::chrono::ceil<std::chrono::milliseconds>(moment - Clock::now()).count();
      if (left <= 0) return true;
      pollfd wanted{pipe_, POLLIN, 0};
      if (::poll(&wanted, 1, static_cast<int>(left)) <= 0) continue;
      const bool wasReady = isReady_;
      if (!readSome()) return false;
      if (isReady_ && !wasReady && afterReady) moment = Clock::now() + *afterReady;
    }
  }

  bool isReady() const { return isReady_; }

 private:
  bool readSome() {
    const ssize_t count = ::read(pipe_, reinterpret_cast<char*>(&record_) + have_, sizeof record_ - have_);
    if (count <= 0) return false;
    have_ += static_cast<std::size_t>(count);
    if (have_ < sizeof record_) return true;
    have_ = 0;
    isReady_ = isReady_ || record_.kind == Record::Kind::Ready;
    ledger_.note(record_);
    return true;
  }

  const int pipe_;
  Ledger& ledger_;
  Record record_{};
  std::size_t have_ = 0;
  bool isReady_ = false;
};

class Tormentor {
 public:
  Tormentor(bool closes, std::uint64_t seed, std::string place)
      : closes_(closes), random_(seed), place_(std::move(place)) {}

  void endOnce() {
    if (endings_ % kEndingsPerRoot == 0) changeRoot();
    const Ending ending = closes_ ? drawClosing() : Ending::Killed;
    const std::size_t droppedBefore = ledger_.dropped;
    ledger_.groupsUnderWay = 0;
    const Child child = start({root_, random_(), ledger_.lastVersion(), ending, -1, -1});
    Listener listener(child.pipe, ledger_);
    letItWork(listener);
    if (listener.isReady() && oneIn(8)) intrude(root_, child.process, findings_);
    closes_ ? close(child, listener) : kill(child, listener);
    if (ledger_.groupsUnderWay > 0) ++inGroups_;
    if (finishesAll(ending) && ledger_.dropped > droppedBefore)
      blame(nameOf(ending) + std::string(", what was asked for was dropped"));
    ++endings_;
    inspect(root_, ending, ledger_, findings_);
    if (oneIn(8)) endSession(root_, ledger_, findings_);
  }

  void finish() {
    orphans_ += findings_.orphans.size();
    acknowledged_ += ledger_.acknowledged;
    failed_ += ledger_.failed;
    dropped_ += ledger_.dropped;
    groups_ += ledger_.groups;
    if (findings_.faults.empty()) std::filesystem::remove_all(root_);
  }

  const char* noun() const { return closes_ ? "closings" : "kills"; }
  std::size_t endings() const { return endings_; }
  const Findings& findings() const { return findings_; }
  std::size_t orphans() const { return orphans_; }
  std::size_t acknowledged() const { return acknowledged_; }
  std::size_t failed() const { return failed_; }
  std::size_t dropped() const { return dropped_; }
  std::size_t groups() const { return groups_; }
  std::size_t inGroups() const { return inGroups_; }
  const std::string& root() const { return root_; }

 private:
  bool oneIn(unsigned int n) { return random_() % n == 0; }
  void blame(const std::string& fault) { findings_.faults.push_back(fault); }

  Ending drawClosing() {
    constexpr std::array<Ending, 5> endings = {Ending::AtRest, Ending::Busy, Ending::Impatient, Ending::ShutDown,
                                               Ending::LetGo};
    return endings.at(static_cast<std::size_t>(random_() % endings.size()));
  }

  // One in four is ended while it is still opening its stores, the others at work.
  void letItWork(Listener& listener) {
    const bool isEarly = oneIn(4);
    const auto delay = std::chrono::microseconds(random_() % (isEarly ? 30000 : 60000));
    if (isEarly) {
      (void)listener.until(Clock::now() + delay);
    } else {
      (void)listener.until(Clock::now() + kPatience, delay);
      if (!listener.isReady()) blame("the worker does not get ready");
    }
  }

  void kill(const Child& child, Listener& listener) {
    (void)::kill(child.process, SIGKILL);
    const int status = takeLeave(child, listener);
    if (!WIFSIGNALED(status) || WTERMSIG(status) != SIGKILL) {
      blame("the worker ended by itself, status " + std::to_string(status));
    }
  }

  void close(const Child& child, Listener& listener) {
    (void)::close(child.control);
    if (listener.until(Clock::now() + kPatience)) {
      blame("closing has not come to its end");
      (void)::kill(child.process, SIGKILL);
    }
    const int status = takeLeave(child, listener);
    if (!WIFEXITED(status) || WEXITSTATUS(status) != 0) blame("closing ended with status " + std::to_string(status));
  }

  // Hears it out; its status.
  int takeLeave(const Child& child, Listener& listener) {
    (void)listener.until(Clock::now() + kPatience);
    (void)::close(child.pipe);
    if (!closes_) (void)::close(child.control);
    int status = 0;
    if (::waitpid(child.process, &status, 0) != child.process) fail("waitpid");
    return status;
  }

  void changeRoot() {
    if (!root_.empty()) finish();
    findings_.orphans.clear();
    ledger_ = Ledger();
    root_ = (std::filesystem::path(place_) / "cellar-crash-XXXXXX").string();
    if (::mkdtemp(root_.data()) == nullptr) fail("mkdtemp");
  }

  const bool closes_;
  std::mt19937_64 random_;
  const std::string place_;
  std::string root_;
  Ledger ledger_;
  Findings findings_;
  std::size_t endings_ = 0;
  std::size_t orphans_ = 0;
  std::size_t acknowledged_ = 0;
  std::size_t failed_ = 0;
  std::size_t dropped_ = 0;
  std::size_t groups_ = 0;
  std::size_t inGroups_ = 0;  // ended in the middle of one
};

int conclude(const Tormentor& tormentor, std::uint64_t seed, double seconds) {
  const Findings& findings = tormentor.findings();
  static constexpr std::array<const char*, kOutcomes> names = {"old",   "new",     "partly written", "older",
                                                               "error", "missing", "forbidden"};
  std::cout << "seed " << seed << ": " << tormentor.endings() << " " << tormentor.noun() << " in " << std::fixed
            << std::setprecision(1) << seconds << " s, " << static_cast<double>(tormentor.endings()) / seconds
            << " a second\n"
            << tormentor.acknowledged() << " operations acknowledged, " << tormentor.failed() << " failed, "
            << tormentor.dropped() << " dropped\n"
            << tormentor.groups() << " groups in one transaction, " << tormentor.inGroups() << " of the "
            << tormentor.noun() << " in the middle of one\n"
            << findings.hostsRefused << " second hosts refused, " << findings.sessionsEnded << " sessions ended\n"
            << findings.intact << " values as they were acknowledged, " << findings.evicted
            << " evicted or never stored\ncaught in the middle:";
  for (std::size_t i = 0; i < names.size(); ++i) std::cout << " " << findings.middle.at(i) << " " << names.at(i);
  std::cout << "\n" << tormentor.orphans() << " files without a record left behind\n";
  for (const std::string& fault : findings.faults) std::cout << "BROKEN: " << fault << "\n";
  if (!findings.faults.empty()) {
    std::cout << "The last root stays: " << tormentor.root() << "\nFAILED: " << findings.faults.size()
              << " broken promises\n";
    return 1;
  }
  std::cout << "PASSED: every promise was kept\n";
  return 0;
}

int torment(bool closes, std::size_t times, std::uint64_t seed, const std::string& place) {
  const auto begin = Clock::now();
  Tormentor tormentor(closes, seed, place);
  const std::size_t step = std::max<std::size_t>(times / 10, 1);
  while (tormentor.endings() < times && tormentor.findings().faults.empty()) {
    tormentor.endOnce();
    if (tormentor.endings() % step != 0) continue;
    std::cout << tormentor.endings() << " of " << times << " " << tormentor.noun() << std::endl;
  }
  tormentor.finish();
  return conclude(tormentor, seed, std::chrono::duration<double>(Clock::now() - begin).count());
}

// In memory where the machine has a place for that: a killed process loses nothing that it has written.
std::string defaultPlace() {
  return ::access("/dev/shm", W_OK | X_OK) == 0 ? "/dev/shm" : std::filesystem::temp_directory_path().string();
}

int run(std::vector<std::string> arguments) {
  if (arguments.size() == 7 && arguments[0] == "--work") {
    work({arguments[1], std::stoull(arguments[2]), static_cast<std::uint32_t>(std::stoul(arguments[3])),
          static_cast<Ending>(std::stoi(arguments[4])), std::stoi(arguments[5]), std::stoi(arguments[6])});
  }
  if (!arguments.empty() && arguments[0] == "--safe") {
    chooseSafeStores();
    arguments.erase(arguments.begin());
  }
  const bool closes = !arguments.empty() && arguments[0] == "--close";
  if (closes) arguments.erase(arguments.begin());
  if (arguments.empty() || arguments.size() > 3)
    throw std::invalid_argument("[--safe] [--close] TIMES [SEED [DIRECTORY]]");
  const std::uint64_t seed = arguments.size() > 1 ? std::stoull(arguments[1]) : std::random_device()();
  return torment(closes, std::stoul(arguments[0]), seed, arguments.size() > 2 ? arguments[2] : defaultPlace());
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
