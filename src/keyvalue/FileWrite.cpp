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

void FileWrite::runAlone() { owner.lock()->begin(shared_from_this()); }

void FileWrite::change(const StoreLock& lock) { owner.lock()->change(lock, *this); }

void FileWrite::note(const StoreLock& lock) { owner.lock()->note(lock, *this); }

void FileWrite::finish() { owner.lock()->dispatch(shared_from_this()); }

}  // namespace velmora::mobile::xplat::cellar
