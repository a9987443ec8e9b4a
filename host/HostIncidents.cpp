// How a host hands incidents to the handler of its options, and to nobody once it is destroyed.

#include <glog/logging.h>

#include <algorithm>
#include <condition_variable>
#include <thread>
#include <utility>

#include "Incident.h"
#include "host/Host.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

// The longest single wait, so that no deadline leaves the range of a 32-bit `time_t`.
constexpr std::chrono::hours kLongestWait(1);

constexpr std::chrono::hours kLongestPatience(24 * 365 * 100);

}  // namespace

// Between the library, whose managers and stores may outlive the host, and a handler that must not. Not a lock that is
// held during a call: the handler may use the host, or destroy it.
class Host::IncidentGate {
 public:
  explicit IncidentGate(IncidentReporter::Handler handler)
      : handler_(std::make_shared<const IncidentReporter::Handler>(std::move(handler))) {}

  void pass(const Incident& incident) {
    const Call call(*this);
    if (const auto& handler = call.handler()) (*handler)(incident);
  }

  // From now on nothing passes. Waits for the calls under way on other threads; false if that takes longer.
  bool close(std::chrono::seconds patience) {
    std::shared_ptr<const IncidentReporter::Handler> released;  // destroyed without the lock
    std::unique_lock<std::mutex> lock(mutex_);
    released.swap(handler_);
    const auto deadline = Clock::now() + std::min<std::chrono::seconds>(patience, kLongestPatience);
    while (isCalledElsewhere()) {
      const auto now = Clock::now();
      if (now >= deadline) return false;
      changed_.wait_until(lock, std::min<Clock::time_point>(deadline, now + kLongestWait));
    }
    lock.unlock();
    return true;
  }

 private:
  using Clock = std::chrono::steady_clock;

  // A passage; without a handler if the gate is closed.
  class Call {
   public:
    explicit Call(IncidentGate& gate) : gate_(gate) {
      const std::lock_guard<std::mutex> lock(gate_.mutex_);
      handler_ = gate_.handler_;
      gate_.callers_.push_back(std::this_thread::get_id());
    }
    ~Call() {
      handler_.reset();  // what it has captured may belong to whoever waits
      const std::lock_guard<std::mutex> lock(gate_.mutex_);
      auto& callers = gate_.callers_;
      callers.erase(std::find(callers.begin(), callers.end(), std::this_thread::get_id()));
      gate_.changed_.notify_all();
    }
    Call(const Call&) = delete;
    Call& operator=(const Call&) = delete;

    const std::shared_ptr<const IncidentReporter::Handler>& handler() const { return handler_; }

   private:
    IncidentGate& gate_;
    std::shared_ptr<const IncidentReporter::Handler> handler_;
  };

  bool isCalledElsewhere() const {
    const auto here = std::this_thread::get_id();
    return std::any_of(callers_.begin(), callers_.end(), [here](std::thread::id caller) { return caller != here; });
  }

  std::mutex mutex_;  // guards the two below
  std::shared_ptr<const IncidentReporter::Handler> handler_;
  std::vector<std::thread::id> callers_;
  std::condition_variable changed_;
};

std::shared_ptr<Host::IncidentGate> Host::gateFor(std::function<void(const Incident&)> handler) {
  return handler ? std::make_shared<IncidentGate>(std::move(handler)) : nullptr;
}

std::shared_ptr<const IncidentReporter> Host::reporterThrough(const std::shared_ptr<IncidentGate>& gate,
                                                              TaskQueueFactory& queues) {
  if (gate == nullptr) return nullptr;
  return std::make_shared<const IncidentReporter>(queues.createWorkQueue(),
                                                  [gate](const Incident& incident) { gate->pass(incident); });
}

void Host::closeIncidentGate(std::chrono::seconds patience) {
  if (incidentGate_ == nullptr || incidentGate_->close(patience)) return;
  LOG(ERROR) << "Host destroyed in the middle of a call of its incident handler.";
}

}  // namespace velmora::mobile::xplat::cellar::host
