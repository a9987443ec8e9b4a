#pragma once

namespace velmora::mobile::xplat::cellar {

// What a keyed store promises for its values. Which can be changed from one start to the next: every value is kept.
enum class Durability : int {
  // For what can be fetched again. A value is written in place: a process that is killed in the middle of an overwrite
  // may leave a part of it. A manifest that is damaged, or cannot be written, discards the store.
  Relaxed = 0,

  // For what cannot. A value is replaced as a whole, has a checksum, and is delivered undamaged or not at all; a
  // failure costs the operation at hand and nothing else. A power cut may lose the most recent values.
  Safe = 1,

  // The same, and what is acknowledged is on the medium: a power cut loses nothing of it.
  Synced = 2
};

}  // namespace velmora::mobile::xplat::cellar
