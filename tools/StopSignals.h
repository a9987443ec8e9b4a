#pragma once

#include <csignal>

namespace velmora::mobile::xplat::cellar::tools {

// Thrown when a signal has come. Not a `std::exception`: those are reported as faults of the files that are read.
struct Interrupted {
  int signal;
};

// While one exists, SIGINT and SIGTERM do not end the process at once, so that what is being done can be finished and
// cleaned up. For the main thread, before there are others.
class StopSignals {
 public:
  StopSignals();
  ~StopSignals();
  StopSignals(const StopSignals&) = delete;
  StopSignals& operator=(const StopSignals&) = delete;

  // Whether one has come, or comes within so many seconds.
  bool comeWithin(double seconds) const;

  // Throws `Interrupted` if one has come. For what is done often, between two parts of a long piece of work.
  void throwIfCome() const;

 private:
  sigset_t signals_{};
  sigset_t before_{};
};

}  // namespace velmora::mobile::xplat::cellar::tools
