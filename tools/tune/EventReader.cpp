#include "tune/EventReader.h"

#include <cstdint>
#include <limits>
#include <nlohmann/json.hpp>
#include <optional>

#include "tune/Access.h"
#include "tune/LineReader.h"
#include "tune/Trace.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

using Json = nlohmann::json;

constexpr const char* kAccessEvent = "qzpkvs_access";
constexpr int kFound = 0;
constexpr std::int64_t kMostSeconds = std::int64_t{1} << 50;
constexpr std::int64_t kMostBytes = std::numeric_limits<std::uint32_t>::max();  // of an item of a store

struct AccessEvent {
  std::string store;
  std::string key;
  bool isHit = false;
  std::int64_t size = 0;
  std::int64_t date = 0;
};

std::optional<std::int64_t> integer(const Json& object, const char* name) {
  const auto member = object.find(name);
  if (member == object.end() || !member->is_number_integer()) return std::nullopt;
  const auto value = member->get<std::int64_t>();
  if (member->is_number_unsigned() && value < 0) return std::nullopt;  // of more than 63 bits
  return value;
}

std::optional<std::string> text(const Json& object, const char* name) {
  const auto member = object.find(name);
  if (member == object.end() || !member->is_string()) return std::nullopt;
  return member->get<std::string>();
}

// 0 if there is none, or one that no clock has.
std::int64_t timeOf(const Json& event) {
  const std::int64_t seconds = integer(event, "time").value_or(0);
  return seconds >= -kMostSeconds && seconds <= kMostSeconds ? seconds : 0;
}

// Empty if the event is not an access, or not one that a store reports.
std::optional<AccessEvent> readAccess(const Json& event) {
  if (text(event, "event") != kAccessEvent) return std::nullopt;
  const auto payload = event.find("payload");
  if (payload == event.end() || !payload->is_object()) return std::nullopt;
  const auto store = text(*payload, "store_name");
  const auto key = text(*payload, "key");
  const auto hit = integer(*payload, "hit");
  const auto size = integer(*payload, "size");
  if (!store || !key || !hit || !size || *size < 0) return std::nullopt;
  return AccessEvent{*store, *key, *hit == kFound, *size, timeOf(event)};
}

// A miss has no size, and neither has a use that is not a fetch, which is reported as a hit of 0 bytes.
void append(const AccessEvent& event, Trace& trace) {
  Access access;
  access.date = event.date;
  if (event.size > 0) access.size = event.size;
  trace.append(event.key, access);
  if (event.isHit && event.size == 0) trace.mayBeEmpty(event.key);
}

}  // namespace

EventCounts readEvents(LineReader& lines, const std::string& store, Trace& trace, const std::function<void()>& onLine) {
  EventCounts counts;
  for (std::string line; lines.next(line); onLine()) {
    if (line.empty()) continue;
    const Json event = Json::parse(line, nullptr, false);
    if (!event.is_object()) {
      ++counts.damagedLines;
      continue;
    }
    const auto access = readAccess(event);
    if (!access) continue;
    if (access->size > kMostBytes) {
      ++counts.damagedLines;
      continue;
    }
    ++counts.accessesOfStores[access->store];
    if (!store.empty() && access->store != store) continue;
    const std::uint64_t keys = trace.keys();
    lines.naming([&] { append(*access, trace); });
    if (!access->isHit) continue;
    ++counts.hits;
    if (trace.keys() > keys) ++counts.firstHits;
  }
  return counts;
}

}  // namespace velmora::mobile::xplat::cellar::tools
