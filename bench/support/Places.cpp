#include "support/Places.h"

#include <pthread.h>
#include <sched.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <system_error>

namespace velmora::mobile::xplat::cellar::bench {

namespace {

const cpu_set_t& allProcessors() {
  static const cpu_set_t all = [] {
    cpu_set_t set;
    CPU_ZERO(&set);
    ::sched_getaffinity(0, sizeof(set), &set);
    return set;
  }();
  return all;
}

cpu_set_t firstOf(const cpu_set_t& all) {
  cpu_set_t set;
  CPU_ZERO(&set);
  for (std::size_t cpu = 0; cpu < CPU_SETSIZE; ++cpu) {
    if (!CPU_ISSET(cpu, &all)) continue;
    CPU_SET(cpu, &set);
    break;
  }
  return set;
}

void runOn(const cpu_set_t& processors) {
  if (::sched_setaffinity(0, sizeof(processors), &processors) != 0) {
    throw std::system_error(errno, std::generic_category(), "sched_setaffinity");
  }
}

}  // namespace

Scratch::Scratch(const Place& place) : path_(place.directory + "/bench-XXXXXX") {
  if (::mkdtemp(path_.data()) == nullptr) throw std::system_error(errno, std::generic_category(), path_);
}

Scratch::~Scratch() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

Pinned::Pinned(bool pinned) : pinned_(pinned) {
  const cpu_set_t& all = allProcessors();
  if (pinned_) runOn(firstOf(all));
}

Pinned::~Pinned() {
  if (pinned_) ::sched_setaffinity(0, sizeof(cpu_set_t), &allProcessors());
}

}  // namespace velmora::mobile::xplat::cellar::bench
