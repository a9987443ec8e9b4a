#include <gtest/gtest.h>

#include <chrono>
#include <fstream>
#include <map>
#include <memory>
#include <nlohmann/json.hpp>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include "AnalyticsEventReporter.h"
#include "host/JsonLinesAnalytics.h"
#include "support/Bytes.h"

// docs/events.md describes what the reporter really sends.

namespace velmora::mobile::xplat::cellar {
namespace {

using test::linesOf;

using Json = nlohmann::json;

// One event of each kind and type, as the sink writes them.
std::vector<Json> reportedEvents() {
  std::ostringstream out;
  const AnalyticsEventReporter reporter(std::make_unique<host::JsonLinesAnalytics>(out));
  using Access = PersistentKeyValueStoreEvent;
  reporter.reportEvent(Access(Access::Hit::Found, "thumbs", "key", "", false, 10, 20));
  reporter.reportEvent(Access(Access::Hit::Missing, "thumbs", "key", "", false, 0, 0));
  using Type = StoreManagerEvent::Type;
  for (const Type type : {Type::Initialization, Type::Pruning, Type::Eviction}) {
    reporter.reportEvent(StoreManagerEvent(type, "thumbs", 10, 20));
  }
  reporter.reportEvent(DiskSizeCalculatorEvent("/data", 1, 2, 0.5, 3, 4));
  reporter.reportEvent(TrashCollectorEvent(std::chrono::milliseconds(1500), 4));
  std::vector<Json> events;
  for (const std::string& line : linesOf(std::istringstream(out.str()))) events.push_back(Json::parse(line));
  return events;
}

std::string kindOf(const Json& value) {
  if (value.is_string()) return "text";
  return value.is_number_integer() ? "integer" : "number";
}

using Fields = std::map<std::string, std::string>;  // with the kinds of their values

Fields fieldsOf(const Json& event) {
  Fields fields;
  for (const auto& [name, value] : event.at("payload").items()) fields[name] = kindOf(value);
  return fields;
}

// What the page says of one event.
struct Section {
  std::vector<Json> examples;
  Fields table;
  std::string text;
};

// "| `size` | integer | bytes |"
void readRow(const std::string& line, Fields& table) {
  if (line.rfind("| `", 0) != 0) return;
  const std::size_t nameEnd = line.find('`', 3);
  const std::size_t kind = line.find("| ", nameEnd) + 2;
  table[line.substr(3, nameEnd - 3)] = line.substr(kind, line.find(' ', kind) - kind);
}

std::map<std::string, Section> readPage() {
  std::map<std::string, Section> sections;
  Section* section = nullptr;
  for (const std::string& line : linesOf(std::ifstream(CELLAR_SOURCE_DIR "/docs/events.md"))) {
    if (line.rfind("## ", 0) == 0) section = nullptr;
    if (line.rfind("## `", 0) == 0) section = &sections[line.substr(4, line.find('`', 4) - 4)];
    if (section == nullptr) continue;
    section->text += line + "\n";
    if (line.rfind('{', 0) == 0) section->examples.push_back(Json::parse(line));
    readRow(line, section->table);
  }
  return sections;
}

TEST(EventsPage, DescribesTheEventsThatAreReportedAndNoOthers) {
  std::set<std::string> reported;
  for (const Json& event : reportedEvents()) reported.insert(event.at("event").get<std::string>());
  std::set<std::string> described;
  for (const auto& [name, section] : readPage()) described.insert(name);
  EXPECT_EQ(described, reported);
}

TEST(EventsPage, HasEachFieldOfEachEventWithItsType) {
  auto page = readPage();
  for (const Json& event : reportedEvents()) {
    const auto name = event.at("event").get<std::string>();
    EXPECT_EQ(page[name].table, fieldsOf(event)) << name;
  }
}

TEST(EventsPage, ShowsLinesAsTheSinkWritesThem) {
  auto page = readPage();
  for (const Json& event : reportedEvents()) {
    const auto name = event.at("event").get<std::string>();
    ASSERT_EQ(page[name].examples.size(), 1U) << name;
    const Json& example = page[name].examples.front();
    EXPECT_EQ(example.at("event"), name);
    EXPECT_EQ(example.at("category"), event.at("category"));
    EXPECT_EQ(fieldsOf(example), fieldsOf(event)) << name;
    EXPECT_EQ(example.size(), event.size());
    EXPECT_TRUE(example.at("time").is_number_integer());
  }
}

TEST(EventsPage, NamesEachTypeOfAManagersEvents) {
  auto page = readPage();
  for (const Json& event : reportedEvents()) {
    if (!event.at("payload").contains("event_type")) continue;
    const auto type = event.at("payload").at("event_type").get<std::string>();
    EXPECT_NE(page["qzdiskstore_logging"].text.find("`" + type + "`"), std::string::npos) << type;
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
