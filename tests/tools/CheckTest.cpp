#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <algorithm>
#include <ctime>
#include <limits>
#include <sstream>
#include <stdexcept>
#include <string>
#include <utility>
#include <vector>

#include "Configuration.h"
#include "Console.h"
#include "InputError.h"
#include "PersistentKeyValueStore.h"
#include "check/CheckReport.h"
#include "check/ConfigurationDocument.h"
#include "check/Faults.h"
#include "check/KnownKeys.h"
#include "check/ResolvedConfiguration.h"
#include "check/Warnings.h"
#include "host/Host.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using testing::ElementsAre;
using testing::HasSubstr;
using testing::IsEmpty;
using Lines = std::vector<std::string>;

Lines linesOf(const Diagnostics& findings) {
  Lines lines;
  for (const Diagnostic& finding : findings) lines.push_back(finding.pointer + ": " + finding.text);
  return lines;
}

Lines warningsOf(const std::string& text, const NameTags& tags = {}) {
  const ConfigurationDocument document = parseConfigurationDocument(text);
  EXPECT_THAT(linesOf(findFaults(document)), IsEmpty());
  return linesOf(findWarnings(document, resolve(document, tags)));
}

// Of a manager with these members.
Lines ofManager(const std::string& members) { return warningsOf(R"({"m": {)" + members + "}}"); }

// Of a store with these members, in a manager that has room.
Lines ofStore(const std::string& members) {
  return warningsOf(R"({"m": {"max_size": "3GB", "stores": {"s": {)" + members + "}}}}");
}

Lines ofCache(const std::string& members) {
  return ofStore(R"("type": "disk_cache", "lru_size_limit": "10MB")" + (members.empty() ? "" : ", " + members));
}

Lines faultsOf(const std::string& text) { return linesOf(findFaults(parseConfigurationDocument(text))); }

// --- Large documents ---

// The time of a processor that a document of so many stores and managers takes, the least of three.
double effortOf(int count) {
  std::string stores;
  std::string managers;
  for (int i = 0; i < count; ++i) {
    stores += ", \"s" + std::to_string(i) + R"(": {"type": "pkvs", "odd": 1})";
    managers += ", \"m" + std::to_string(i) + "\": {}";
  }
  const std::string text = R"({"m": {"stores": {"s": {"type": "pkvs"})" + stores + "}}" + managers + "}";
  const std::string refused =
      R"({"m": {"max_size": 1, "stores": {"s": {"type": "pkvs"})" + stores + "}}" + managers + "}";
  double least = std::numeric_limits<double>::infinity();
  for (int round = 0; round < 3; ++round) {
    const std::clock_t begin = std::clock();
    const ConfigurationDocument document = parseConfigurationDocument(text);
    EXPECT_THAT(findFaults(document), IsEmpty());
    const auto warnings = findWarnings(document, resolve(document, {}));
    EXPECT_GE(warnings.size(), static_cast<std::size_t>(count));
    EXPECT_EQ(faultsOf(refused).size(), 1U);
    least = std::min(least, static_cast<double>(std::clock() - begin));
  }
  return least;
}

// Eight times as much takes eight times as long, not 64 times.
TEST(CheckOfALargeDocument, TakesTimeInProportionToItsSize) { EXPECT_LT(effortOf(4000), 24 * effortOf(500)); }

// --- Unknown and ignored keys ---

TEST(CheckWarnings, AMisspeltKeyIsNamedWithTheNearestKnownOne) {
  EXPECT_THAT(ofManager(R"("max_sise": "1MB")"), ElementsAre("/m/max_sise: unknown key; did you mean 'max_size'?"));
  EXPECT_THAT(ofManager(R"("maxSize": "1MB")"), ElementsAre("/m/maxSize: unknown key; did you mean 'max_size'?"));
  EXPECT_THAT(ofCache(R"("prune_stratgey": "lru")"),
              ElementsAre("/m/stores/s/prune_stratgey: unknown key; did you mean 'prune_strategy'?"));
  EXPECT_THAT(ofCache(R"("colour": "red")"), ElementsAre("/m/stores/s/colour: unknown key"));
  EXPECT_THAT(ofManager(R"("area": "shared", "session_scoped": false)"), IsEmpty());
}

TEST(CheckWarnings, AKeyAtTheWrongLevelIsSaidToBelongToTheOther) {
  EXPECT_THAT(ofManager(R"("lru_size_limit": "1MB")"),
              ElementsAre("/m/lru_size_limit: unknown key; it is one of stores"));
  EXPECT_THAT(ofCache(R"("prune_interval": "1 hours")"),
              ElementsAre("/m/stores/s/prune_interval: unknown key; it is one of managers"));
}

TEST(CheckWarnings, AKeyThatTheTypeIgnoresIsNamed) {
  EXPECT_THAT(ofStore(R"("type": "unmanaged", "stale_age": "1 days")"),
              ElementsAre("/m/stores/s/stale_age: stores of type unmanaged ignore this key"));
  EXPECT_THAT(ofStore(R"("type": "pkvs", "lru_size_limit": "1MB")"),
              ElementsAre("/m/stores/s/lru_size_limit: stores of type pkvs ignore this key"));
  EXPECT_THAT(
      ofCache(R"("max_size": "1MB")"),
      ElementsAre("/m/stores/s/max_size: stores of type disk_cache ignore this key; their limit is 'lru_size_limit'"));
  EXPECT_THAT(ofStore(R"("type": "pkvs", "stale_age": "1 days", "inline_data": true, "capacity": 3)"), IsEmpty());
}

TEST(CheckWarnings, AKeyThatIsGivenTwiceIsNamed) {
  EXPECT_THAT(ofManager(R"("max_size": "1MB", "max_size": "2MB")"),
              ElementsAre("/m/max_size: is defined more than once here; only the last counts"));
  EXPECT_THAT(ofCache(R"("version": 1, "capacity": [{"version": 1}], "version": 2)"),
              ElementsAre(R"(/m/stores/s/capacity: [{"version":1}] is not an integer: the store has no capacity limit)",
                          "/m/stores/s/version: is defined more than once here; only the last counts"));
}

TEST(CheckWarnings, StoresThatAreNoObjectAreNamed) {
  EXPECT_THAT(ofManager(R"("stores": [])"), ElementsAre("/m/stores: is not an object: there are no stores"));
  EXPECT_THAT(ofManager(R"("stores": {})"), IsEmpty());
}

// --- Values ---

TEST(CheckWarnings, ASizeThatWrappedIsNamedWithWhatItHasBecome) {
  EXPECT_THAT(ofManager(R"("max_size": "4GB")"),
              ElementsAre("/m/max_size: '4GB' does not fit into 32 bits and becomes 0 B"));
  EXPECT_THAT(ofManager(R"("max_size": "5GB")"),
              ElementsAre("/m/max_size: '5GB' does not fit into 32 bits and becomes 1.0 GB"));
  EXPECT_THAT(ofManager(R"("max_size": "-1B")"),
              ElementsAre("/m/max_size: '-1B' does not fit into 32 bits and becomes 4.0 GB"));
  EXPECT_THAT(ofManager(R"("max_size": "4294967295B")"), IsEmpty());
  EXPECT_THAT(ofManager(R"("max_size": "4095MB")"), IsEmpty());
  EXPECT_THAT(ofStore(R"("type": "unmanaged", "max_size": "4097MB")"),
              ElementsAre("/m/stores/s/max_size: '4097MB' does not fit into 32 bits and becomes 1.0 MB"));
  EXPECT_THAT(ofStore(R"("type": "disk_cache", "lru_size_limit": "8193MB", "survival_size": "4097MB")"),
              ElementsAre("/m/stores/s/lru_size_limit: '8193MB' does not fit into 32 bits and becomes 1.0 MB",
                          "/m/stores/s/survival_size: '4097MB' does not fit into 32 bits and becomes 1.0 MB"));
}

TEST(CheckWarnings, ADurationThatWrappedIsNamedWithWhatItHasBecome) {
  EXPECT_THAT(ofStore(R"("type": "pkvs", "stale_age": "137 years")"),
              ElementsAre("/m/stores/s/stale_age: '137 years' does not fit into 32 bits and becomes 294 days 17 "
                          "hours 31 minutes 44 seconds"));
  EXPECT_THAT(ofStore(R"("type": "pkvs", "stale_age": "136 years")"), IsEmpty());
  EXPECT_THAT(ofManager(R"("prune_interval": "50000 days")"),
              ElementsAre("/m/prune_interval: '50000 days' does not fit into 32 bits and becomes 289 days 17 hours "
                          "31 minutes 44 seconds"));
}

TEST(CheckWarnings, AVersionThatWrappedIsNamed) {
  EXPECT_THAT(ofCache(R"("version": -1)"),
              ElementsAre("/m/stores/s/version: -1 does not fit into 32 bits and becomes 4294967295"));
  EXPECT_THAT(ofCache(R"("version": 4294967296)"),
              ElementsAre("/m/stores/s/version: 4294967296 does not fit into 32 bits and becomes 0"));
  EXPECT_THAT(ofCache(R"("version": 4294967295)"), IsEmpty());
}

TEST(CheckWarnings, TextBehindTheUnitIsNamed) {
  EXPECT_THAT(ofManager(R"("max_size": "20 MB or so")"), ElementsAre("/m/max_size: 'or so' after the unit is ignored"));
  EXPECT_THAT(ofManager(R"("max_size": " 20  MB ")"), IsEmpty());
}

TEST(CheckWarnings, ACapacityThatIsNoIntegerOrNegativeIsNamed) {
  EXPECT_THAT(ofCache(R"("capacity": "100")"),
              ElementsAre("/m/stores/s/capacity: \"100\" is not an integer: the store has no capacity limit"));
  EXPECT_THAT(ofCache(R"("capacity": 1.5)"),
              ElementsAre("/m/stores/s/capacity: 1.5 is not an integer: the store has no capacity limit"));
  EXPECT_THAT(ofCache(R"("capacity": -1)"),
              ElementsAre("/m/stores/s/capacity: -1 is negative: the store has no capacity limit"));
  EXPECT_THAT(ofCache(R"("capacity": 100)"), IsEmpty());
}

// --- Limits ---

TEST(CheckWarnings, ACacheWithoutALimitIsNamed) {
  EXPECT_THAT(ofStore(R"("type": "disk_cache")"),
              ElementsAre("/m/stores/s/lru_size_limit: is 0 B: each round of pruning empties the cache"));
  EXPECT_THAT(ofStore(R"("type": "disk_cache", "lru_size_limit": "1B")"), IsEmpty());
  EXPECT_THAT(ofStore(R"("type": "unmanaged", "is_cache": true)"),
              ElementsAre("/m/stores/s/max_size: is 0 B: the cache is emptied whenever it is opened"));
  EXPECT_THAT(ofStore(R"("type": "unmanaged")"), IsEmpty());
  EXPECT_THAT(ofStore(R"("type": "unmanaged", "is_cache": true, "max_size": "1B")"), IsEmpty());
}

TEST(CheckWarnings, ASurvivalSizeAboveTheLimitIsNamed) {
  EXPECT_THAT(ofCache(R"("survival_size": "11MB")"),
              ElementsAre("/m/stores/s/survival_size: 11.0 MB is more than the limit of 10.0 MB: a device that is "
                          "short of space would keep more"));
  EXPECT_THAT(ofCache(R"("survival_size": "10MB")"), IsEmpty());
}

TEST(CheckWarnings, TheVideoStrategyWithoutItsMetadataIsNamed) {
  EXPECT_THAT(ofCache(R"("prune_strategy": "video_download")"),
              ElementsAre("/m/stores/s/prune_strategy: video_download without the metadata_factory of that name: after "
                          "a restart no item has a priority"));
  EXPECT_THAT(ofCache(R"("prune_strategy": "video_download", "metadata_factory": "video_download")"), IsEmpty());
}

TEST(CheckWarnings, TheGreedyDualStrategyNeedsNothingElse) {
  EXPECT_THAT(ofCache(R"("prune_strategy": "greedy_dual")"), IsEmpty());
}

TEST(CheckWarnings, CachesThatTogetherExceedTheirManagersLimitAreNamed) {
  const std::string stores = R"("stores": {"a": {"type": "disk_cache", "lru_size_limit": "6MB"},
      "b": {"type": "unmanaged", "is_cache": true, "max_size": "4MB"}, "c": {"type": "unmanaged", "max_size": "9MB"}})";
  EXPECT_THAT(
      ofManager(R"("max_size": "9MB", )" + stores),
      ElementsAre("/m/max_size: its caches may together have 10.0 MB, more than the manager's limit of 9.0 MB"));
  EXPECT_THAT(ofManager(R"("max_size": "10MB", )" + stores), IsEmpty());
}

TEST(CheckWarnings, UnmanagedCachesThatAloneExceedTheirManagersLimitAreNamed) {
  const std::string caches = R"("stores": {"a": {"type": "disk_cache", "lru_size_limit": "1MB"},
      "b": {"type": "unmanaged", "is_cache": true, "max_size": "4MB"},
      "c": {"type": "unmanaged", "is_cache": true, "max_size": "5MB"}})";
  EXPECT_THAT(
      ofManager(R"("max_size": "8MB", )" + caches),
      ElementsAre("/m/max_size: its unmanaged caches alone may have 9.0 MB, more than the manager's limit of 8.0 MB: "
                  "they count for it, and a round of pruning takes nothing from them",
                  "/m/max_size: its caches may together have 10.0 MB, more than the manager's limit of 8.0 MB"));
  EXPECT_THAT(
      ofManager(R"("max_size": "9MB", )" + caches),
      ElementsAre("/m/max_size: its caches may together have 10.0 MB, more than the manager's limit of 9.0 MB"));
  EXPECT_THAT(ofManager(R"("max_size": "10MB", )" + caches), IsEmpty());
  EXPECT_THAT(ofManager(R"("max_size": "1MB", "stores": {"u": {"type": "unmanaged", "max_size": "9MB"}})"), IsEmpty());
}

TEST(CheckReport, SaysForHowLongALimitMayBeExceeded) {
  const auto report = [](const std::string& interval) {
    CheckResult result;
    result.resolved =
        resolve(parseConfigurationDocument(R"({"m": {"prune_interval": ")" + interval + R"("}})"), NameTags());
    std::ostringstream out;
    Console console(out, false, false);
    printCheck(result, console);
    return out.str();
  };
  EXPECT_THAT(report("2 days"),
              HasSubstr("pruned at most every 2 days: it may be exceeded for 2 days between two rounds\n"));
  EXPECT_THAT(report("0 days"), HasSubstr("never pruned: it may be exceeded for ever\n"));
}

TEST(CheckWarnings, AManagerThatNeverPrunesIsNamedIfItHasWhatNeedsPruning) {
  EXPECT_THAT(
      ofManager(R"("prune_interval": "0 hours", "stores": {"a": {"type": "disk_cache", "lru_size_limit": "6MB"}})"),
      ElementsAre("/m/prune_interval: is 0: the manager never prunes, and its disk caches grow without limit"));
  EXPECT_THAT(ofManager(R"("prune_interval": "0 hours", "stores": {"a": {"type": "pkvs"}})"), IsEmpty());
  EXPECT_THAT(
      ofManager(R"("prune_interval": "1 minutes", "stores": {"a": {"type": "disk_cache", "lru_size_limit": "6MB"}})"),
      IsEmpty());
}

// --- Durability ---

TEST(CheckWarnings, ARelaxedKeyValueStoreAmongTheDocumentsIsNamed) {
  const auto inArea = [](const std::string& area, const std::string& members) {
    return warningsOf(R"({"m": {"max_size": "3GB", "area": ")" + area + R"(", "stores": {"s": {)" + members + "}}}}");
  };
  const std::string warning =
      "/m/stores/s/durability: is relaxed: a kill may damage a value, and a damaged manifest or a full disk loses all "
      "of them; use 'safe' for values that exist nowhere else";
  EXPECT_THAT(inArea("documents", R"("type": "pkvs")"), ElementsAre(warning));
  EXPECT_THAT(inArea("documents", R"("type": "pkvs", "durability": "relaxed")"), ElementsAre(warning));
  EXPECT_THAT(inArea("documents", R"("type": "pkvs", "durability": "safe")"), IsEmpty());
  EXPECT_THAT(inArea("documents", R"("type": "pkvs", "durability": "synced")"), IsEmpty());
  EXPECT_THAT(inArea("documents", R"("type": "disk_cache", "lru_size_limit": "1MB")"), IsEmpty());
  EXPECT_THAT(inArea("documents", R"("type": "unmanaged")"), IsEmpty());
  EXPECT_THAT(inArea("caches", R"("type": "pkvs")"), IsEmpty());
  EXPECT_THAT(inArea("shared", R"("type": "pkvs")"), IsEmpty());
}

TEST(CheckWarnings, AnUnmanagedStoreIgnoresDurability) {
  EXPECT_THAT(ofStore(R"("type": "unmanaged", "durability": "safe")"),
              ElementsAre("/m/stores/s/durability: stores of type unmanaged ignore this key"));
}

// --- Names ---

TEST(CheckWarnings, ANameThatCannotBeAFileNameIsNamed) {
  EXPECT_THAT(ofCache(R"("name": "a/b")"),
              ElementsAre("/m/stores/s/name: 'a/b' contains a '/' and leads outside the manager's directory"));
  EXPECT_THAT(ofCache(R"("name": "")"), ElementsAre("/m/stores/s/name: the name is empty"));
  EXPECT_THAT(ofCache("\"name\": \"a\\u0000b\""),
              ElementsAre("/m/stores/s/name: the name contains a zero byte, at which the system truncates it"));
  EXPECT_THAT(ofManager(R"("stores": {"a/b": {"type": "pkvs"}})"),
              ElementsAre("/m/stores/a~1b: 'a/b' contains a '/' and leads outside the manager's directory"));
  const std::string longest(255 - 4, 'x');  // with "__v1" behind it
  EXPECT_THAT(ofCache(R"("name": ")" + longest + "\""), IsEmpty());
  EXPECT_THAT(ofCache(R"("name": "x)" + longest + "\""),
              ElementsAre("/m/stores/s/name: the directory's name has 256 bytes, more than the 255 that file systems "
                          "allow"));
}

TEST(CheckWarnings, StoresOfOneManagerThatShareADirectoryAreNamed) {
  EXPECT_THAT(ofManager(R"("stores": {"a": {"type": "pkvs"}, "b": {"type": "pkvs", "name": "a"}})"),
              ElementsAre("/m/stores/b: shares its directory a__v1 with /m/stores/a"));
  // Two spellings of one directory.
  const std::string text =
      R"({"m": {"stores": {"a_250": {"type": "pkvs", "has_version": true}, "a": {"type": "pkvs"}}}})";
  NameTags tags;
  tags.versionTag = "250";
  EXPECT_THAT(warningsOf(text, tags), ElementsAre("/m/stores/a: shares its directory a_250_v1 with /m/stores/a_250"));
  tags.versionTag = "251";
  EXPECT_THAT(warningsOf(text, tags), IsEmpty());
}

TEST(CheckWarnings, StoresOfOneNameInSeveralPlacesAreNamed) {
  EXPECT_THAT(ofManager(R"("stores": {"a": {"type": "pkvs"}, "b": {"type": "pkvs", "name": "a", "version": 2}})"),
              ElementsAre("/m/stores/b: has the name 'a' of /m/stores/a: they cannot be told apart in events and "
                          "log lines"));
  EXPECT_THAT(ofManager(R"("stores": {"a": {"type": "pkvs"}, "b": {"type": "pkvs", "name": "c"}})"), IsEmpty());
}

TEST(CheckWarnings, ManagersThatShareADirectoryAreNamed) {
  EXPECT_THAT(warningsOf(R"({"m": {}, "n": {}})"),
              ElementsAre("/n: shares its directory caches/_store_ with /m: each removes the other's stores"));
  EXPECT_THAT(warningsOf(R"({"m": {}, "n": {"session_scoped": false}, "o": {"area": "shared"}})"), IsEmpty());
}

// --- What the library refuses ---

TEST(CheckFaults, EachIsNamedWithItsPlaceInTheParsersWords) {
  EXPECT_THAT(
      faultsOf(R"({"m": {"max_size": "20mb", "area": 3, "session_scoped": 1, "stores": {"a": {"type": "disk"}, "b": {},
                   "c": {"type": "pkvs", "stale_age": "1 hour"}, "d": 7}}, "n": 4})"),
      ElementsAre("/m/max_size: Invalid unit 'mb', use B, KB, MB or GB.", "/m/area: type must be string, but is number",
                  "/m/session_scoped: type must be boolean, but is number",
                  "/m/stores/a/type: Invalid type 'disk', use unmanaged, pkvs or disk_cache.",
                  "/m/stores/b: has no 'type', use unmanaged, pkvs or disk_cache",
                  "/m/stores/c/stale_age: Invalid unit 'hour', use minutes, hours, days or years.",
                  "/m/stores/d: a store must be an object", "/n: a manager must be an object"));
}

TEST(CheckFaults, ADurabilityThatDoesNotExistIsNamedInTheParsersWords) {
  const auto ofType = [](const std::string& type, const std::string& durability) {
    return faultsOf(R"({"m": {"stores": {"s": {"type": ")" + type + R"(", "durability": )" + durability + "}}}}");
  };
  for (const char* const type : {"pkvs", "disk_cache"}) {
    EXPECT_THAT(ofType(type, R"("save")"), ElementsAre("/m/stores/s/durability: Invalid durability 'save', use "
                                                       "relaxed, safe or synced."));
    EXPECT_THAT(ofType(type, "true"), ElementsAre("/m/stores/s/durability: type must be string, but is boolean"));
  }
}

TEST(CheckFaults, IdentifiersThatAreMetTwiceAreNamedWithTheirPlace) {
  EXPECT_THAT(faultsOf(R"({"m": {}, "m": {}})"), ElementsAre("/m: is defined twice here"));
  EXPECT_THAT(faultsOf(R"({"m": {"stores": {"s": {"type": "pkvs"}, "s": {"type": "pkvs"}}}})"),
              ElementsAre("/m/stores/s: is defined twice here"));
  EXPECT_THAT(faultsOf(R"({"m": {"stores": {"s": {"type": "pkvs"}}}, "n": {"stores": {"s": {"type": "pkvs"}}}})"),
              ElementsAre("/n/stores/s: another manager has a store of this identifier"));
}

TEST(CheckFaults, ADocumentThatIsNoObjectIsOne) {
  EXPECT_THAT(faultsOf("[]"), ElementsAre(": is not an object of managers"));
  EXPECT_THAT(faultsOf("{}"), IsEmpty());
}

TEST(CheckFaults, ADocumentOfAbsurdDepthIsRefusedBeforeAnythingIsDoneWithIt) {
  const auto nested = [](std::size_t depth) {
    return R"({"m": {"stores": {"s": {"type": "pkvs", "capacity": )" + std::string(depth, '[') +
           std::string(depth, ']') + "}}}}";
  };
  EXPECT_THAT(faultsOf(nested(196)), IsEmpty());
  EXPECT_THROW(faultsOf(nested(197)), InputError);
  EXPECT_THROW(faultsOf(nested(1'000'000)), InputError);
}

TEST(CheckFaults, AreThereExactlyWhenTheLibraryRefuses) {
  for (const char* const text :
       {"{}", R"({"m": {}})", R"({"m": {"max_size": "1.5MB"}})", R"({"m": {"stores": {"a": {"type": "pkvs"}}}})",
        R"({"m": {"stores": {"a": {"type": "disk_cache", "metadata_factory": "x"}}}})",
        R"({"m": {"max_size": "1.5MB", "max_size": "1MB"}})",
        R"({"m": {"stores": {"a": {"type": "pkvs", "name": 1}}}})"}) {
    bool refused = false;
    try {
      const Configuration configuration(text);
    } catch (const std::exception&) {
      refused = true;
    }
    EXPECT_EQ(!faultsOf(text).empty(), refused) << text;
  }
}

TEST(CheckFaults, KeepNoWarningBackThatCanBeGivenInSpiteOfThem) {
  const ConfigurationDocument document = parseConfigurationDocument(R"({
    "m": { "max_size": "10mb", "max_sise": "1MB", "stores": {
      "a": { "type": "disk_cache", "lru_size_limit": "5GB", "stale_age": 3, "survival_size": "1KB" } } },
    "n": { "area": "documents", "max_size": "1KB", "stores": {
      "b": { "type": "disk_cache", "lru_size_limit": "2KB", "max_size": "1KB" },
      "c": { "type": "pkvs", "odd": 1, "capacity": "3", "version": "x" },
      "d": { "type": "none", "odd": 1 }, "e": 7, "a": { "type": "pkvs" } } },
    "o": 3 })");
  const Diagnostics faults = findFaults(document);
  EXPECT_EQ(faults.size(), 7U);
  EXPECT_THAT(linesOf(findWarningsBeside(faults, document, NameTags())),
              ElementsAre("/n/max_size: its caches may together have 2.0 KB, more than the manager's limit of 1.0 KB",
                          "/n/stores/b/max_size: stores of type disk_cache ignore this key; their limit is "
                          "'lru_size_limit'",
                          "/m/max_sise: unknown key; did you mean 'max_size'?",
                          "/m/stores/a/lru_size_limit: '5GB' does not fit into 32 bits and becomes 1.0 GB",
                          "/n/stores/c/odd: unknown key",
                          "/n/stores/c/capacity: \"3\" is not an integer: the store has no capacity limit"));
  EXPECT_THAT(findWarningsBeside({{"", "", ""}}, parseConfigurationDocument("[]"), NameTags()), IsEmpty());
}

// --- Known keys ---

// A value of no type that any key takes: whoever reads the key complains.
TEST(KnownKeys, AreThoseThatTheParserReads) {
  const auto isRead = [](const std::string& document) { return !faultsOf(document).empty(); };
  for (const std::string& key : keysOfManagers()) {
    if (key == "stores") continue;  // lenient
    EXPECT_TRUE(isRead(R"({"m": {")" + key + R"(": []}})")) << key;
  }
  for (const std::string& type : storeTypes()) {
    for (const std::string& key : keysOfStores(type)) {
      if (key == "type" || key == "capacity") continue;  // required; lenient
      EXPECT_TRUE(isRead(R"({"m": {"stores": {"s": {"type": ")" + type + R"(", ")" + key + R"(": []}}}})")) << key;
    }
  }
}

TEST(KnownKeys, TheNearestIsNotFarOff) {
  EXPECT_EQ(nearestKey("max_siz", keysOfManagers()), "max_size");
  EXPECT_EQ(nearestKey("sessionScoped", keysOfManagers()), "session_scoped");
  EXPECT_EQ(nearestKey("hello_world", keysOfManagers()), "");
  EXPECT_EQ(nearestKey(std::string(1000, 'a'), keysOfManagers()), "");
}

// --- The resolved configuration ---

TEST(CheckReport, NamesTheDirectoriesAsTheHostKitDoes) {
  const test::TemporaryDirectory root;
  const std::string text = R"({"m": {"stores": {"s": {"type": "pkvs"}}}, "n": {"area": "documents"}})";
  for (const std::string session : {"", "Alice"}) {
    host::HostOptions options;
    options.configuration = text;
    options.root = root.file("of" + session);
    options.versionTag = "250";
    host::Host host(std::move(options));
    (void)host.store<PersistentKeyValueStore>("s", session);
    const auto resolved = resolve(parseConfigurationDocument(text), {"250", "", "", session});
    const std::string directory = "of" + session + "/" + resolved.at(0).directory;
    EXPECT_TRUE(root.exists(directory + "/" + resolved.at(0).stores.at(0).directory)) << directory;
  }
}

TEST(CheckReport, FillsInEveryDefault) {
  CheckResult result;
  result.file = "storage.json";
  const ConfigurationDocument document =
      parseConfigurationDocument(R"({"m": {"stores": {"c": {"type": "disk_cache"}, "k": {"type": "pkvs",
                                     "durability": "synced"}, "u": {"type": "unmanaged"}}}})");
  result.resolved = resolve(document, {"250", "en", "US", "Alice"});
  std::ostringstream out;
  Console console(out, false, false);
  printCheck(result, console);
  EXPECT_EQ(out.str(), R"(
m
  caches/_store_%41lice, a session's; limit 20.0 MB, pruned at most every 1 hour: it may be exceeded for 1 hour between two rounds
  unmanaged, and no cache: u; what is in them counts for the limit, is never pruned and may exceed it for ever
  c: disk_cache in c_250_v1
      pruned to 0 B, to 0 B when space is short; strategy null, metadata null
      any number of items, stale after 50 years, a file for each value, relaxed
  k: pkvs in k_250_v1
      any number of items, stale after 50 years, a file for each value, synced
  u: unmanaged in u_250_v1
      no cache: never emptied


storage.json: 1 manager, 3 stores, 0 warnings
)");
}

TEST(CheckReport, ForMachinesHasBytesAndSeconds) {
  CheckResult result;
  const ConfigurationDocument document = parseConfigurationDocument(
      R"({"m": {"area": "shared", "max_size": "1KB", "session_scoped": false, "prune_interval": "2 days",
          "stores": {"s": {"type": "disk_cache", "lru_size_limit": "3KB", "capacity": 7, "locale_sensitive": true,
                 "durability": "safe"}}}})");
  result.resolved = resolve(document, {"250", "en", "US", ""});
  result.warnings = findWarnings(document, result.resolved);
  const OrderedJson json = checkAsJson(result);
  const OrderedJson& manager = json.at("managers").at(0);
  EXPECT_EQ(manager.at("directory"), "shared/_sessionlessStore");
  EXPECT_EQ(manager.at("max_size"), 1024);
  EXPECT_EQ(manager.at("prune_interval"), 172800);
  EXPECT_EQ(manager.at("stores").at(0).at("lru_size_limit"), 3072);
  EXPECT_EQ(manager.at("stores").at(0).at("capacity"), 7);
  EXPECT_EQ(manager.at("stores").at(0).at("durability"), "safe");
  EXPECT_EQ(manager.at("stores").at(0).at("directory"), "s_en_US_250_v1");
  EXPECT_EQ(json.at("warnings").at(0).at("kind"), "over_manager_limit");
  EXPECT_EQ(json.at("warnings").at(0).at("path"), "/m/max_size");
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
