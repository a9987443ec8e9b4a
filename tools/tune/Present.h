#pragma once

#include <cstdint>
#include <string>

#include "tune/Tuning.h"

namespace velmora::mobile::xplat::cellar::tools {

// The limit and the strategy that a store has in a configuration. Throws `InputError` if the configuration has a fault
// or no such disk cache. The store is found by its identifier or, because events contain names, by its name.
TuneSettings configuredSettings(const std::string& file, const std::string& name);

// A limit as a configuration has it, "50MB" or "50 MB", or a number of bytes. Throws `InputError`, also for one that a
// store cannot have: in a configuration, 4 GB and more wrap.
std::int64_t parseLimit(const std::string& text);

}  // namespace velmora::mobile::xplat::cellar::tools
