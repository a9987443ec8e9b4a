#include "keyvalue/FileWrite.h"

#include "Clock.h"
#include "keyvalue/ValueWriter.h"

namespace velmora::mobile::xplat::cellar {

FileWrite::~FileWrite() {
  if (state == State::New || state == State::Done) return;
  if (const auto valueWriter = owner.lock()) valueWriter->rollBack(*this);
}

DiskCacheItem FileWrite::record() const {
  const auto date = static_cast<std::int32_t>(Clock::now());
  return {key, key, size, false, date, date, extendedMetadata};
}

}  // namespace velmora::mobile::xplat::cellar
