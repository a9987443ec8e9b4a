#include "tune/FleetText.h"

#include <cstdint>

#include "Format.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

std::string limitText(std::int64_t limit) {
  return limit == 0 ? "no space" : formatWholeSize(static_cast<std::uint64_t>(limit));
}

// "lru": 64 MB is enough on 50 % of the devices, 96 MB on 90 %, ...
std::string enoughText(const std::string& strategy, const std::vector<std::int64_t>& enough) {
  std::string text = "\"" + strategy + "\": ";
  for (const unsigned share : kShownPercentiles) {
    const bool isFirst = share == kShownPercentiles.front();
    text += (isFirst ? "" : ", ") + limitText(enoughFor(enough, share)) + (isFirst ? " is enough on " : " on ") +
            std::to_string(share) + " %" + (isFirst ? " of the devices" : "");
  }
  return text;
}

}  // namespace

std::vector<std::string> fleetTexts(const Fleet& fleet, const Tuning& tuning) {
  std::vector<std::string> texts;
  texts.push_back(formatCount(tuning.requests, "request", "requests") + " of " +
                  formatCount(fleet.devices, "device", "devices") + ", each with the weight of its requests");
  if (fleet.sampledDevices > 0) {
    texts.push_back(formatCount(fleet.sampledDevices, "device has", "devices have") +
                    " figures that a sample of the keys gave");
  }
  if (fleet.shortDevices > 0) {
    texts.push_back(formatCount(fleet.shortDevices, "device has", "devices have") +
                    " too few requests to say which limit is enough; the following shares are of the others");
  }
  for (const auto& [strategy, devices] : fleet.partialStrategies) {
    texts.push_back("\"" + strategy + "\" is left out: only " + formatCount(devices, "device has", "devices have") +
                    " figures of it");
  }
  for (const auto& [strategy, enough] : fleet.enough) texts.push_back(enoughText(strategy, enough));
  return texts;
}

}  // namespace velmora::mobile::xplat::cellar::tools
