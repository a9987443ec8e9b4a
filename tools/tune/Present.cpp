#include "tune/Present.h"

#include <charconv>
#include <cstdint>
#include <limits>
#include <memory>
#include <system_error>

#include "InputError.h"
#include "StoreDefinition.h"
#include "check/ConfigurationDocument.h"
#include "check/Faults.h"
#include "check/ResolvedConfiguration.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

struct Unit {
  const char* name;
  std::uint32_t bytes;
};
constexpr Unit kUnits[] = {{"", 1}, {"B", 1}, {"KB", 1U << 10U}, {"MB", 1U << 20U}, {"GB", 1U << 30U}};

// The store of that identifier or, because events contain names, of that name.
std::shared_ptr<const StoreDefinition> findStore(const ResolvedConfiguration& resolved, const std::string& store) {
  for (const ResolvedManager& manager : resolved) {
    for (const ResolvedStore& candidate : manager.stores) {
      if (candidate.identifier == store || candidate.definition->name == store) return candidate.definition;
    }
  }
  return nullptr;
}

// How a configuration names it.
std::string nameOf(PruneStrategyIdentifier strategy) {
  if (strategy == PruneStrategyIdentifier::GreedyDual) return strategies::kGreedyDual;
  return strategy == PruneStrategyIdentifier::VideoDownload ? strategies::kVideoDownload
                                                            : strategies::kLeastRecentlyUsed;
}

}  // namespace

TuneSettings configuredSettings(const std::string& file, const std::string& name) {
  const ConfigurationDocument document = readConfigurationDocument(file);
  const Diagnostics faults = findFaults(document);
  if (!faults.empty()) throw InputError(file + ": " + faults.front().pointer + ": " + faults.front().text);
  const auto store = findStore(resolve(document, {}), name);
  if (store == nullptr) throw InputError(file + ": there is no store '" + name + "'");
  if (store->type != StoreDefinition::Type::DiskCache) {
    throw InputError(file + ": store '" + name + "' is not a disk cache and has no size limit");
  }
  if (store->maxSize == 0) throw InputError(file + ": the limit of store '" + name + "' is 0");
  TuneSettings settings;
  settings.present = store->maxSize;
  settings.strategy = nameOf(std::static_pointer_cast<const DiskCacheDefinition>(store)->pruneStrategy);
  return settings;
}

std::int64_t parseLimit(const std::string& text) {
  std::int64_t number = 0;
  const char* const end = text.data() + text.size();
  const auto [rest, error] = std::from_chars(text.data(), end, number);
  std::string unit(rest, end);
  unit.erase(0, unit.find_first_not_of(' '));
  for (const Unit& known : kUnits) {
    if (error == std::errc::invalid_argument || unit != known.name) continue;
    constexpr std::int64_t most = std::numeric_limits<std::uint32_t>::max();
    if (error == std::errc() && number > 0 && number <= most / known.bytes) return number * known.bytes;
    throw InputError("'" + text + "' is not from 1 byte to 4095MB, which is the most that a store can have");
  }
  throw InputError("'" + text + "' is not a whole number with B, KB, MB or GB, or of bytes");
}

}  // namespace velmora::mobile::xplat::cellar::tools
