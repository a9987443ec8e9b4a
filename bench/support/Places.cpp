#include "support/Places.h"

#include <fcntl.h>
#include <pthread.h>
#include <sched.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <system_error>

#include "lower_bounds/FileLowerBound.h"
#include "support/Values.h"

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

void settle(const std::string& path) {
  const int directory = ::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  const bool isSettled = directory != -1 && ::syncfs(directory) == 0;
  const int error = errno;
  if (directory != -1) (void)::close(directory);
  if (!isSettled) throw std::system_error(error, std::generic_category(), path);
}

Scratch::Scratch(const Place& place) : path_(place.directory + "/bench-XXXXXX") {
  settle(place.directory);
  if (::mkdtemp(path_.data()) == nullptr) throw std::system_error(errno, std::generic_category(), path_);
}

Scratch::~Scratch() {
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

void warmFiles(const Place& place, std::size_t bytes) {
  const Scratch scratch(place);
  const Bytes value = valueOf(1U << 20U);
  for (std::size_t written = 0; written < bytes; written += value.size()) {
    writeFile(scratch / std::to_string(written), value);
  }
}

Pinned::Pinned(bool pinned) : pinned_(pinned) {
  const cpu_set_t& all = allProcessors();
  if (pinned_) runOn(firstOf(all));
}

Pinned::~Pinned() {
  if (pinned_) ::sched_setaffinity(0, sizeof(cpu_set_t), &allProcessors());
}

}  // namespace velmora::mobile::xplat::cellar::bench
