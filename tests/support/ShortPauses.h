#pragma once

namespace velmora::mobile::xplat::cellar::test {

// While it lives, `nanosleep` returns at once in the whole process, so that what is tried again after a pause is tried
// again at once. One at a time. Thread-safe.
class ShortPauses {
 public:
  ShortPauses();
  ShortPauses(const ShortPauses&) = delete;
  ShortPauses& operator=(const ShortPauses&) = delete;
  ~ShortPauses();
};

}  // namespace velmora::mobile::xplat::cellar::test
