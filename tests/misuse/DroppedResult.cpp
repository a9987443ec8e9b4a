// expected: ignoring return value of .*nodiscard
#include <cellar/host/Futures.h>

using namespace velmora::mobile::xplat::cellar;  // NOLINT: as in an application

void twice(Future<int> number) {
  host::map(number, [](int value) { return 2 * value; });
}
