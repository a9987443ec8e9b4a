#pragma once

#include <csignal>

namespace velmora::mobile::xplat::cellar::tools {

// Thrown for a signal that has come. It is not an exception that could be taken for a fault of what is looked at.
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
