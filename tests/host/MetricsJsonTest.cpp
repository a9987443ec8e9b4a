// The JSON of metrics is what docs/metrics.md describes.

#include <gtest/gtest.h>

#include <fstream>
#include <limits>
#include <map>
#include <nlohmann/json.hpp>
#include <string>

#include "host/Metrics.h"
#include "support/Bytes.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using Json = nlohmann::json;
using Fields = std::map<std::string, std::string>;  // the names of members with the kinds of their values

StoreMetrics fullStore() {
  StoreMetrics store;
  store.identifier = "thumbs";
  store.name = "pictures";
  store.type = StoreDefinition::Type::DiskCache;
  store.isCreated = true;
  store.maxBytes = 1;
  store.survivalBytes = 2;
  store.maxItems = 3;
  store.staleAge = 4;
  store.bytes = 5;
  store.items = 6;
  store.hits = 7;
  store.misses = 8;
  store.writes = 9;
  store.evictions = 10;
  store.lastPrune = PruneMetrics{11, 12, 13};
  return store;
}

// With each member.
HostMetrics fullMetrics() {
  HostMetrics metrics;
  metrics.time = 20;
  metrics.managers = {{"media", true, "alice", true, 21, 22, 23, {fullStore()}}};
  metrics.queues = QueueMetrics{24, 25};
  metrics.trash = TrashMetrics{26, 27};
  return metrics;
}

Json parsed(const HostMetrics& metrics) { return Json::parse(toJson(metrics)); }

TEST(MetricsJson, HasEachFigure) {
  const Json expectedStore{{"identifier", "thumbs"},
                           {"name", "pictures"},
                           {"type", "disk_cache"},
                           {"created", true},
                           {"max_bytes", 1},
                           {"survival_bytes", 2},
                           {"max_items", 3},
                           {"stale_age", 4},
                           {"bytes", 5},
                           {"items", 6},
                           {"hits", 7},
                           {"misses", 8},
                           {"writes", 9},
                           {"evictions", 10},
                           {"last_prune", {{"time", 11}, {"from_bytes", 12}, {"to_bytes", 13}}}};
  const Json expectedManager{
      {"name", "media"}, {"session_scoped", true}, {"session", "alice"}, {"built", true},
      {"max_bytes", 21}, {"prune_interval", 22},   {"bytes", 23},        {"stores", Json::array({expectedStore})}};
  EXPECT_EQ(parsed(fullMetrics()), (Json{{"time", 20},
                                         {"managers", Json::array({expectedManager})},
                                         {"queues", {{"waiting", 24}, {"running", 25}}},
                                         {"trash", {{"entries", 26}, {"bytes", 27}}}}));
}

TEST(MetricsJson, HasNoMemberForWhatIsAbsent) {
  HostMetrics metrics;
  metrics.managers.emplace_back();
  metrics.managers[0].stores.emplace_back();
  metrics.trash = TrashMetrics{};
  EXPECT_EQ(toJson(metrics),
            R"({"time":0,"managers":[{"name":"","session_scoped":false,"built":false,"max_bytes":0,"prune_interval":0,)"
            R"("stores":[{"identifier":"","name":"","type":"unmanaged","created":false}]}],"trash":{"entries":0}})");
  EXPECT_EQ(toJson({}), R"({"time":0,"managers":[]})");
}

TEST(MetricsJson, OfAPruneThatIsUnderWayHasNoEnd) {
  HostMetrics metrics = fullMetrics();
  metrics.managers[0].stores[0].lastPrune->toBytes.reset();
  EXPECT_EQ(parsed(metrics).at("managers")[0].at("stores")[0].at("last_prune"),
            (Json{{"time", 11}, {"from_bytes", 12}}));
}

TEST(MetricsJson, NamesEachTypeAsTheConfigurationDoes) {
  HostMetrics metrics = fullMetrics();
  using Type = StoreDefinition::Type;
  for (const auto& [type, name] : std::map<Type, std::string>{
           {Type::Unmanaged, "unmanaged"}, {Type::PKVS, "pkvs"}, {Type::DiskCache, "disk_cache"}}) {
    metrics.managers[0].stores[0].type = type;
    EXPECT_EQ(parsed(metrics).at("managers")[0].at("stores")[0].at("type"), name);
  }
}

TEST(MetricsJson, KeepsTheLargestNumbers) {
  HostMetrics metrics = fullMetrics();
  constexpr auto largest = std::numeric_limits<std::uint64_t>::max();
  metrics.managers[0].stores[0].bytes = largest;
  metrics.managers[0].stores[0].hits = largest;
  const Json store = parsed(metrics).at("managers")[0].at("stores")[0];
  EXPECT_EQ(store.at("bytes").get<std::uint64_t>(), largest);
  EXPECT_EQ(store.at("hits").get<std::uint64_t>(), largest);
}

TEST(MetricsJson, OfHostileNamesIsOneLineThatCanBeRead) {
  HostMetrics metrics = fullMetrics();
  for (const std::string& name : {std::string("\"}],\"x\":1,//"), std::string("line\nfeed\r\t\\"), std::string("../.."),
                                  std::string("zero\0byte", 9), std::string("\xe2\x80\xa8\xf0\x9f\x98\x80")}) {
    metrics.managers[0].name = name;
    metrics.managers[0].session = name;
    metrics.managers[0].stores[0].identifier = name;
    metrics.managers[0].stores[0].name = name;
    const std::string text = toJson(metrics);
    EXPECT_EQ(text.find('\n'), std::string::npos);
    const Json manager = Json::parse(text).at("managers")[0];
    EXPECT_EQ(manager.at("name"), name);
    EXPECT_EQ(manager.at("session"), name);
    EXPECT_EQ(manager.at("stores")[0].at("identifier"), name);
    EXPECT_EQ(manager.at("stores")[0].at("name"), name);
    EXPECT_EQ(manager.size(), 8U);
  }
}

TEST(MetricsJson, ReplacesWhatIsNotUtf8) {
  HostMetrics metrics = fullMetrics();
  metrics.managers[0].session = "a\xff\xc3";
  EXPECT_EQ(parsed(metrics).at("managers")[0].at("session"), "a\xef\xbf\xbd\xef\xbf\xbd");
}

// The page

std::string kindOf(const Json& value) {
  if (value.is_string()) return "text";
  if (value.is_number_integer()) return "integer";
  return value.is_boolean() ? "boolean" : value.type_name();
}

Fields fieldsOf(const Json& object) {
  Fields fields;
  for (const auto& [name, value] : object.items()) fields[name] = kindOf(value);
  return fields;
}

// "| `bytes` | integer | of all items |", by the headings above.
std::map<std::string, Fields> tablesOfThePage() {
  std::map<std::string, Fields> tables;
  std::string heading;
  for (const std::string& line : test::linesOf(std::ifstream(CELLAR_SOURCE_DIR "/docs/metrics.md"))) {
    if (line.rfind("## ", 0) == 0) heading = line.substr(3);
    if (line.rfind("| `", 0) != 0) continue;
    const std::size_t nameEnd = line.find('`', 3);
    const std::size_t kind = line.find("| ", nameEnd) + 2;
    tables[heading][line.substr(3, nameEnd - 3)] = line.substr(kind, line.find(' ', kind) - kind);
  }
  return tables;
}

std::map<std::string, Fields> tablesOf(const Json& host) {
  const Json manager = host.at("managers").at(0);
  const Json store = manager.at("stores").at(0);
  return {{"The host", fieldsOf(host)},
          {"Each of `managers`", fieldsOf(manager)},
          {"Each of `stores`", fieldsOf(store)},
          {"`last_prune`", fieldsOf(store.at("last_prune"))},
          {"`queues`", fieldsOf(host.at("queues"))},
          {"`trash`", fieldsOf(host.at("trash"))}};
}

TEST(MetricsPage, HasEachMemberWithItsType) { EXPECT_EQ(tablesOfThePage(), tablesOf(parsed(fullMetrics()))); }

TEST(MetricsPage, ShowsALineWithEachMember) {
  for (const std::string& line : test::linesOf(std::ifstream(CELLAR_SOURCE_DIR "/docs/metrics.md"))) {
    if (line.rfind('{', 0) != 0) continue;
    EXPECT_EQ(tablesOf(Json::parse(line)), tablesOf(parsed(fullMetrics())));
    return;
  }
  FAIL() << "There is no example.";
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
