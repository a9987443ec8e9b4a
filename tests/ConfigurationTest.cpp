#include "Configuration.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <limits>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <type_traits>
#include <unordered_map>
#include <utility>
#include <vector>

#include "JsonValue.h"
#include "LarderException.h"
#include "support/Barrier.h"
#include "support/GroupingLocale.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using testing::HasSubstr;

string quoted(const string& text) { return JsonValue(text).dump(); }

// A document with the manager "m", whose value has the given members.
string managerWith(const string& members) { return R"({"m":{)" + members + "}}"; }

// A document with one store, "s" of manager "m", whose value has the given members.
string storeWith(const string& members) { return managerWith(R"("stores":{"s":{)" + members + "}}"); }

std::shared_ptr<const StoreManagerDefinition> manager(const string& members) {
  return Configuration(managerWith(members)).getManager("m");
}

template <class Definition> std::shared_ptr<const Definition> store(const string& members) {
  const std::shared_ptr<const StoreDefinition> definition = Configuration(storeWith(members)).getStore("s");
  return std::static_pointer_cast<const Definition>(definition);
}

std::shared_ptr<const UnmanagedStoreDefinition> unmanaged(const string& more = "") {
  return store<UnmanagedStoreDefinition>(R"("type":"unmanaged")" + more);
}
std::shared_ptr<const PKVSDefinition> pkvs(const string& more = "") {
  return store<PKVSDefinition>(R"("type":"pkvs")" + more);
}
std::shared_ptr<const DiskCacheDefinition> diskCache(const string& more = "") {
  return store<DiskCacheDefinition>(R"("type":"disk_cache")" + more);
}

std::uint32_t sizeOf(const string& text) { return manager(R"("max_size":)" + quoted(text))->maxSize; }
std::uint32_t durationOf(const string& text) { return manager(R"("prune_interval":)" + quoted(text))->pruneInterval; }

// The message of the std::invalid_argument that the document leads to.
string invalid(const string& json) {
  try {
    const Configuration configuration(json);
  } catch (const std::invalid_argument& exception) {
    return exception.what();
  }
  return "nothing was thrown";
}

// The description of the ConfigurationException that the document leads to.
string structural(const string& json) {
  try {
    const Configuration configuration(json);
  } catch (const ConfigurationException& exception) {
    EXPECT_EQ(exception.code(), 0);
    EXPECT_STREQ(exception.domain(), "QZConfigurationErrorDomain");
    return exception.description();
  }
  return "nothing was thrown";
}

string sizeError(const string& text) { return invalid(managerWith(R"("max_size":)" + quoted(text))); }
string durationError(const string& text) { return invalid(managerWith(R"("prune_interval":)" + quoted(text))); }
string badSizeUnit(const string& unit) { return "Invalid unit '" + unit + "', use B, KB, MB or GB."; }
string badDurationUnit(const string& unit) { return "Invalid unit '" + unit + "', use minutes, hours, days or years."; }

template <class Exception> bool throws(const string& json) {
  try {
    const Configuration configuration(json);
  } catch (const Exception&) {
    return true;
  } catch (const std::exception& exception) {
    ADD_FAILURE() << json.substr(0, 200) << ": " << exception.what();
    return false;
  }
  return false;
}

bool isTypeError(const string& json) { return throws<JsonValue::type_error>(json); }

// Managers

TEST(Configuration, AnEmptyDocumentHasNoManagersAndNoStores) {
  const Configuration configuration("{}");
  EXPECT_THROW(configuration.getManager("m"), ConfigurationException);
  EXPECT_THROW(configuration.getStore("s"), ConfigurationException);
}

TEST(Configuration, AnUnknownManagerIsNamedInTheError) {
  const Configuration configuration(managerWith(""));
  try {
    configuration.getManager("x y");
    FAIL();
  } catch (const ConfigurationException& exception) {
    EXPECT_STREQ(exception.description(), "Manager 'x y' not found.");
    EXPECT_STREQ(exception.what(),
                 "domain: QZConfigurationErrorDomain; code: 0; description: Manager 'x y' not found. .");
  }
}

TEST(Configuration, AnUnknownStoreIsNamedInTheError) {
  const Configuration configuration(storeWith(R"("type":"pkvs","name":"other")"));
  try {
    configuration.getStore("other");
    FAIL() << "a store is found by its identifier, not by its name";
  } catch (const ConfigurationException& exception) {
    EXPECT_STREQ(exception.description(), "Store 'other' not found.");
  }
  try {
    configuration.getStore("");
    FAIL();
  } catch (const ConfigurationException& exception) {
    EXPECT_STREQ(exception.description(), "Store '' not found.");
  }
}

TEST(Configuration, AManagerGivenAsAnEmptyObjectHasTheDefaults) {
  const auto definition = manager("");
  EXPECT_EQ(definition->name, "m");
  EXPECT_EQ(definition->area, Area::Caches);
  EXPECT_EQ(definition->maxSize, 20971520U);
  EXPECT_EQ(definition->pruneInterval, 3600U);
  EXPECT_TRUE(definition->sessionScoped);
  EXPECT_TRUE(definition->stores.empty());
}

TEST(Configuration, AManagerTakesItsValuesFromTheDocument) {
  const auto definition =
      manager(R"("area":"documents","max_size":"3KB","prune_interval":"2 days","session_scoped":false)");
  EXPECT_EQ(definition->area, Area::Documents);
  EXPECT_EQ(definition->maxSize, 3072U);
  EXPECT_EQ(definition->pruneInterval, 172800U);
  EXPECT_FALSE(definition->sessionScoped);
}

TEST(Configuration, EachAreaHasItsText) {
  EXPECT_EQ(manager(R"("area":"caches")")->area, Area::Caches);
  EXPECT_EQ(manager(R"("area":"documents")")->area, Area::Documents);
  EXPECT_EQ(manager(R"("area":"shared")")->area, Area::Shared);
}

TEST(Configuration, AnUnknownAreaIsQuotedInTheError) {
  EXPECT_EQ(invalid(managerWith(R"("area":"Caches")")), "Invalid area 'Caches', use caches, documents or shared.");
  EXPECT_EQ(invalid(managerWith(R"("area":"")")), "Invalid area '', use caches, documents or shared.");
}

TEST(Configuration, StoresThatAreNoObjectGiveAManagerWithoutStores) {
  for (const char* stores : {"[]", R"([{"type":"pkvs"}])", R"("text")", "7", "1.5", "true", "null", "{}"}) {
    EXPECT_TRUE(manager(string(R"("stores":)") + stores)->stores.empty()) << stores;
  }
}

TEST(Configuration, SeveralManagersAreFoundByTheirNames) {
  const Configuration configuration(R"({"a":{"area":"shared"},"":{"area":"documents"},"b":{}})");
  EXPECT_EQ(configuration.getManager("a")->area, Area::Shared);
  EXPECT_EQ(configuration.getManager("")->area, Area::Documents);
  EXPECT_EQ(configuration.getManager("")->name, "");
  EXPECT_EQ(configuration.getManager("b")->name, "b");
}

// Stores

TEST(Configuration, AManagerAndTheConfigurationShareOneDefinition) {
  const Configuration configuration(storeWith(R"("type":"pkvs")"));
  EXPECT_EQ(configuration.getManager("m")->stores.size(), 1U);
  EXPECT_EQ(configuration.getManager("m")->stores.at("s"), configuration.getStore("s"));
  EXPECT_EQ(configuration.getManager("m"), configuration.getManager("m"));
}

TEST(Configuration, DefinitionsOutliveTheConfiguration) {
  auto configuration = std::make_unique<Configuration>(storeWith(R"("type":"pkvs","name":"kept")"));
  const auto definition = configuration->getStore("s");
  configuration.reset();
  EXPECT_EQ(definition->name, "kept");
}

TEST(Configuration, AnUnmanagedStoreHasTheDefaults) {
  const auto definition = unmanaged();
  EXPECT_EQ(definition->type, StoreDefinition::Type::Unmanaged);
  EXPECT_EQ(definition->name, "s");
  EXPECT_EQ(definition->managerName, "m");
  EXPECT_FALSE(definition->localeSensitive);
  EXPECT_FALSE(definition->hasVersion);
  EXPECT_EQ(definition->version, 1U);
  EXPECT_EQ(definition->maxSize, 0U);
  EXPECT_FALSE(definition->isCache);
  EXPECT_FALSE(definition->isManaged);
}

TEST(Configuration, AnUnmanagedStoreTakesItsValuesFromTheDocument) {
  const auto definition = unmanaged(
      R"(,"name":"n","locale_sensitive":true,"has_version":true,"version":7,"is_cache":true,"max_size":"5MB")");
  EXPECT_EQ(definition->name, "n");
  EXPECT_TRUE(definition->localeSensitive);
  EXPECT_TRUE(definition->hasVersion);
  EXPECT_EQ(definition->version, 7U);
  EXPECT_TRUE(definition->isCache);
  EXPECT_EQ(definition->maxSize, 5242880U);
}

TEST(Configuration, AKeyValueStoreHasTheDefaults) {
  const auto definition = pkvs();
  EXPECT_EQ(definition->type, StoreDefinition::Type::PKVS);
  EXPECT_EQ(definition->maxSize, 0U);
  EXPECT_FALSE(definition->isCache);
  EXPECT_TRUE(definition->isManaged);
  EXPECT_FALSE(definition->inlineData);
  EXPECT_EQ(definition->staleAge, 1576800000U);
  EXPECT_EQ(definition->capacity, std::nullopt);
}

TEST(Configuration, AKeyValueStoreTakesItsValuesFromTheDocument) {
  const auto definition = pkvs(R"(,"inline_data":true,"stale_age":"3 minutes","capacity":100)");
  EXPECT_TRUE(definition->inlineData);
  EXPECT_EQ(definition->staleAge, 180U);
  EXPECT_EQ(definition->capacity, 100);
}

TEST(Configuration, ADiskCacheHasTheDefaults) {
  const auto definition = diskCache();
  EXPECT_EQ(definition->type, StoreDefinition::Type::DiskCache);
  EXPECT_EQ(definition->maxSize, 0U);
  EXPECT_TRUE(definition->isCache);
  EXPECT_TRUE(definition->isManaged);
  EXPECT_FALSE(definition->inlineData);
  EXPECT_EQ(definition->staleAge, 1576800000U);
  EXPECT_EQ(definition->lruSizeLimit, 0U);
  EXPECT_EQ(definition->survivalSize, 0U);
  EXPECT_EQ(definition->metadataFactory, ExtendedMetadataFactoryIdentifier::Null);
  EXPECT_EQ(definition->pruneStrategy, PruneStrategyIdentifier::Null);
  EXPECT_EQ(definition->capacity, std::nullopt);
}

TEST(Configuration, ADiskCacheTakesItsValuesFromTheDocument) {
  const auto definition =
      diskCache(R"(,"inline_data":true,"stale_age":"1 days","lru_size_limit":"10MB","survival_size":"1MB",)"
                R"("metadata_factory":"video_download","prune_strategy":"video_download","capacity":9)");
  EXPECT_TRUE(definition->inlineData);
  EXPECT_EQ(definition->staleAge, 86400U);
  EXPECT_EQ(definition->lruSizeLimit, 10485760U);
  EXPECT_EQ(definition->maxSize, definition->lruSizeLimit);
  EXPECT_EQ(definition->survivalSize, 1048576U);
  EXPECT_EQ(definition->metadataFactory, ExtendedMetadataFactoryIdentifier::VideoDownload);
  EXPECT_EQ(definition->pruneStrategy, PruneStrategyIdentifier::VideoDownload);
  EXPECT_EQ(definition->capacity, 9);
}

TEST(Configuration, EachPruneStrategyAndFactoryHasItsText) {
  EXPECT_EQ(diskCache(R"(,"prune_strategy":"null")")->pruneStrategy, PruneStrategyIdentifier::Null);
  EXPECT_EQ(diskCache(R"(,"prune_strategy":"lru")")->pruneStrategy, PruneStrategyIdentifier::LRU);
  EXPECT_EQ(diskCache(R"(,"prune_strategy":"greedy_dual")")->pruneStrategy, PruneStrategyIdentifier::GreedyDual);
  EXPECT_EQ(diskCache(R"(,"metadata_factory":"null")")->metadataFactory, ExtendedMetadataFactoryIdentifier::Null);
}

TEST(Configuration, UnknownTypesFactoriesAndStrategiesAreQuotedInTheError) {
  EXPECT_EQ(invalid(storeWith(R"("type":"PKVS")")), "Invalid type 'PKVS', use unmanaged, pkvs or disk_cache.");
  EXPECT_EQ(invalid(storeWith(R"("type":"disk_cache","metadata_factory":"lru")")),
            "Invalid factory 'lru', use null or video_download.");
  EXPECT_EQ(invalid(storeWith(R"("type":"disk_cache","prune_strategy":"fifo")")),
            "Invalid prune 'fifo', use null, lru or video_download.");
}

TEST(Configuration, AnUnknownFactoryIsReportedBeforeAnUnknownStrategy) {
  EXPECT_EQ(invalid(storeWith(R"("type":"disk_cache","prune_strategy":"p","metadata_factory":"f")")),
            "Invalid factory 'f', use null or video_download.");
}

TEST(Configuration, AVersionIsStoredAsAnUnsigned32BitNumber) {
  EXPECT_EQ(unmanaged(R"(,"has_version":true)")->version, 1U);
  EXPECT_EQ(unmanaged(R"(,"version":0)")->version, 0U);
  EXPECT_EQ(unmanaged(R"(,"version":4294967295)")->version, 4294967295U);
  EXPECT_EQ(unmanaged(R"(,"version":4294967303)")->version, 7U);
  EXPECT_EQ(unmanaged(R"(,"version":-1)")->version, 4294967295U);
}

TEST(Configuration, KeysOfOtherTypesAndUnknownKeysAreIgnoredWhateverTheyHold) {
  EXPECT_EQ(
      pkvs(R"(,"max_size":"5MB","is_cache":7,"lru_size_limit":"x","prune_strategy":[],"other":{"a":[1]})")->maxSize,
      0U);
  EXPECT_EQ(unmanaged(R"(,"stale_age":"never","inline_data":1,"capacity":"x","metadata_factory":3)")->maxSize, 0U);
  EXPECT_TRUE(diskCache(R"(,"is_cache":false,"max_size":17)")->isCache);
  EXPECT_EQ(manager(R"("unknown":[{"deep":[null]}],"type":5)")->maxSize, 20971520U);
}

TEST(Configuration, CapacityCountsOnlyWhenItIsAnInteger) {
  for (const char* value : {R"("100")", R"("20MB")", "1.5", "100.0", "1e2", "true", "false", "null", "[]", "[5]", "{}",
                            "99999999999999999999"}) {
    const string member = string(R"(,"capacity":)") + value;
    EXPECT_EQ(pkvs(member)->capacity, std::nullopt) << value;
    EXPECT_EQ(diskCache(member)->capacity, std::nullopt) << value;
  }
  EXPECT_EQ(pkvs(R"(,"capacity":0)")->capacity, 0);
  EXPECT_EQ(diskCache(R"(,"capacity":-5)")->capacity, -5);
  EXPECT_EQ(pkvs(R"(,"capacity":9223372036854775807)")->capacity, std::numeric_limits<std::int64_t>::max());
  EXPECT_EQ(pkvs(R"(,"capacity":-9223372036854775808)")->capacity, std::numeric_limits<std::int64_t>::min());
}

TEST(Configuration, AStoreWithoutATypeIsAMissingKey) {
  EXPECT_TRUE(throws<JsonValue::out_of_range>(storeWith("")));
  EXPECT_TRUE(throws<JsonValue::out_of_range>(storeWith(R"("name":"n")")));
}

// Sizes and durations

TEST(Configuration, SizesComeInPowersOf1024) {
  EXPECT_EQ(sizeOf("7B"), 7U);
  EXPECT_EQ(sizeOf("7KB"), 7168U);
  EXPECT_EQ(sizeOf("20MB"), 20971520U);
  EXPECT_EQ(sizeOf("1GB"), 1073741824U);
  EXPECT_EQ(sizeOf("0MB"), 0U);
}

TEST(Configuration, DurationsComeInMinutesHoursDaysAndYearsOf365Days) {
  EXPECT_EQ(durationOf("1 minutes"), 60U);
  EXPECT_EQ(durationOf("1 hours"), 3600U);
  EXPECT_EQ(durationOf("1 days"), 86400U);
  EXPECT_EQ(durationOf("1 years"), 31536000U);
  EXPECT_EQ(durationOf("50 years"), 1576800000U);
  EXPECT_EQ(durationOf("0 days"), 0U);
}

TEST(Configuration, SizesWrapAt32Bits) {
  EXPECT_EQ(sizeOf("3GB"), 3221225472U);
  EXPECT_EQ(sizeOf("4GB"), 0U);
  EXPECT_EQ(sizeOf("5GB"), 1073741824U);
  EXPECT_EQ(sizeOf("4095MB"), 4293918720U);
  EXPECT_EQ(sizeOf("4096MB"), 0U);
  EXPECT_EQ(sizeOf("4097MB"), 1048576U);
  EXPECT_EQ(sizeOf("4294967295B"), 4294967295U);
}

TEST(Configuration, DurationsWrapAt32Bits) {
  EXPECT_EQ(durationOf("136 years"), 4288896000U);
  EXPECT_EQ(durationOf("137 years"), 25464704U);
  EXPECT_EQ(durationOf("71582788 minutes"), 4294967280U);
  EXPECT_EQ(durationOf("71582789 minutes"), 44U);
}

TEST(Configuration, WhiteSpaceAroundNumberAndUnitAndWhatFollowsTheUnitAreIgnored) {
  EXPECT_EQ(sizeOf("20 MB"), 20971520U);
  EXPECT_EQ(sizeOf(" \t\n5\r\n KB  and more"), 5120U);
  EXPECT_EQ(sizeOf("+5B"), 5U);
  EXPECT_EQ(sizeOf("007B"), 7U);
  EXPECT_EQ(durationOf("2hours"), 7200U);
  EXPECT_EQ(durationOf("2 hours ago"), 7200U);
}

TEST(Configuration, ANegativeNumberWrapsLikeAnyOther) { EXPECT_EQ(sizeOf("-1B"), 4294967295U); }

TEST(Configuration, UnitsAreCaseSensitiveAndPlural) {
  EXPECT_EQ(sizeError("20mb"), badSizeUnit("mb"));
  EXPECT_EQ(sizeError("20Mb"), badSizeUnit("Mb"));
  EXPECT_EQ(sizeError("1TB"), badSizeUnit("TB"));
  EXPECT_EQ(sizeError("5K"), badSizeUnit("K"));
  EXPECT_EQ(sizeError("5KB,"), badSizeUnit("KB,"));
  EXPECT_EQ(durationError("1 hour"), badDurationUnit("hour"));
  EXPECT_EQ(durationError("1 Hours"), badDurationUnit("Hours"));
  EXPECT_EQ(durationError("5 seconds"), badDurationUnit("seconds"));
}

TEST(Configuration, OnlyWholeDecimalNumbersAreRead) {
  EXPECT_EQ(sizeError("1.5MB"), badSizeUnit(".5MB"));
  EXPECT_EQ(sizeError("1,024KB"), badSizeUnit(",024KB"));
  EXPECT_EQ(sizeError("1e3B"), badSizeUnit("e3B"));
  EXPECT_EQ(sizeError("0x10B"), badSizeUnit("x10B"));
  EXPECT_EQ(durationError("1.5 hours"), badDurationUnit(".5"));
}

TEST(Configuration, ATextWithoutANumberOrUnitQuotesAnEmptyUnit) {
  for (const char* text : {"", " ", "MB", "five MB", "-", "5", "5 "}) {
    EXPECT_EQ(sizeError(text), "Invalid unit '', use B, KB, MB or GB.") << text;
  }
  EXPECT_EQ(durationError("hours"), "Invalid unit '', use minutes, hours, days or years.");
  EXPECT_EQ(durationError(""), badDurationUnit(""));
}

TEST(Configuration, ANumberBeyond32BitsCountsAsNone) {
  EXPECT_EQ(sizeError("4294967296B"), badSizeUnit(""));
  EXPECT_EQ(sizeError("99999999999999999999999B"), badSizeUnit(""));
  EXPECT_EQ(durationError("4294967296 days"), badDurationUnit(""));
}

TEST(Configuration, EverySizeAndDurationOfAStoreIsChecked) {
  EXPECT_EQ(invalid(storeWith(R"("type":"unmanaged","max_size":"1X")")), badSizeUnit("X"));
  EXPECT_EQ(invalid(storeWith(R"("type":"pkvs","stale_age":"1X")")), badDurationUnit("X"));
  EXPECT_EQ(invalid(storeWith(R"("type":"disk_cache","stale_age":"1X")")), badDurationUnit("X"));
  EXPECT_EQ(invalid(storeWith(R"("type":"disk_cache","lru_size_limit":"1X")")), badSizeUnit("X"));
  EXPECT_EQ(invalid(storeWith(R"("type":"disk_cache","survival_size":"1X")")), badSizeUnit("X"));
}

TEST(Configuration, NumbersAreReadAlikeWhateverTheProcessLocale) {
  const test::GroupingLocale locale;
  EXPECT_EQ(sizeOf("1024KB"), 1048576U);
  EXPECT_EQ(sizeError("1.024KB"), badSizeUnit(".024KB"));
  EXPECT_EQ(durationOf("1000 minutes"), 60000U);
}

// Duplicates

TEST(Configuration, AManagerNameMetTwiceIsAnError) {
  EXPECT_EQ(structural(R"({"m":{},"n":{},"m":{}})"), "Duplicate store manager definition.");
  EXPECT_EQ(structural(R"({"m":{},"\u006d":{}})"), "Duplicate store manager definition.");
  EXPECT_EQ(structural(R"({"":{},"":{}})"), "Duplicate store manager definition.");
}

TEST(Configuration, AManagerNameMetTwiceIsReportedBeforeTheSecondOneIsRead) {
  EXPECT_EQ(structural(R"({"m":{},"m":{"area":"bad"}})"), "Duplicate store manager definition.");
  EXPECT_EQ(structural(R"({"m":{},"m":5})"), "Duplicate store manager definition.");
  EXPECT_EQ(invalid(R"({"m":{"area":"bad"},"m":{}})"), "Invalid area 'bad', use caches, documents or shared.");
}

TEST(Configuration, AStoreIdentifierMetTwiceInOneManagerIsAnError) {
  EXPECT_EQ(structural(managerWith(R"("stores":{"s":{"type":"pkvs"},"t":{"type":"pkvs"},"s":{"type":"pkvs"}})")),
            "Duplicate store definition.");
}

TEST(Configuration, AStoreIdentifierMetInTwoManagersIsAnError) {
  EXPECT_EQ(structural(R"({"a":{"stores":{"s":{"type":"pkvs"}}},"b":{"stores":{"s":{"type":"unmanaged"}}}})"),
            "Duplicate store definition.");
}

TEST(Configuration, AStoreIdentifierMetTwiceIsReportedBeforeTheSecondOneIsRead) {
  EXPECT_EQ(structural(managerWith(R"("stores":{"s":{"type":"pkvs"},"s":{"type":"bad"}})")),
            "Duplicate store definition.");
  EXPECT_EQ(structural(managerWith(R"("stores":{"s":{"type":"pkvs"},"s":5})")), "Duplicate store definition.");
  EXPECT_EQ(invalid(managerWith(R"("stores":{"s":{"type":"bad"},"s":{"type":"pkvs"}})")),
            "Invalid type 'bad', use unmanaged, pkvs or disk_cache.");
}

TEST(Configuration, StoreNamesAndAManagerNamedLikeAStoreMayRepeat) {
  const Configuration configuration(
      R"({"m":{"stores":{"m":{"type":"pkvs","name":"n"},"t":{"type":"pkvs","name":"n"}}}})");
  EXPECT_EQ(configuration.getStore("m")->name, configuration.getStore("t")->name);
}

// Order and strictness

TEST(Configuration, TheFirstFaultInDocumentOrderIsReported) {
  EXPECT_EQ(invalid(R"({"z":{"area":"of z"},"a":{"area":"of a"}})"),
            "Invalid area 'of z', use caches, documents or shared.");
  EXPECT_EQ(invalid(managerWith(R"("stores":{"z":{"type":"of z"},"a":{"type":"of a"}})")),
            "Invalid type 'of z', use unmanaged, pkvs or disk_cache.");
  EXPECT_EQ(invalid(R"({"z":{"stores":{"s":{"type":"of s"}}},"a":{"area":"of a"}})"),
            "Invalid type 'of s', use unmanaged, pkvs or disk_cache.");
}

// A member with a fault, and a part of the message that tells which one was met.
struct Fault {
  string member;
  string message;
};

// The message for a document with all the faults from `first` on, the last one written first.
template <class Wrap> string firstFault(const std::vector<Fault>& faults, std::size_t first, Wrap wrap) {
  string members;
  for (std::size_t i = faults.size(); i > first; --i) members += (members.empty() ? "" : ",") + faults[i - 1].member;
  try {
    const Configuration configuration(wrap(members));
  } catch (const std::exception& exception) {
    return exception.what();
  }
  return "nothing was thrown";
}

template <class Wrap> void expectReadingOrder(const std::vector<Fault>& faults, Wrap wrap) {
  for (std::size_t i = 0; i < faults.size(); ++i) {
    EXPECT_THAT(firstFault(faults, i, wrap), HasSubstr(faults[i].message)) << faults[i].member;
  }
}

TEST(Configuration, AManagersKeysAreReadInAFixedOrder) {
  expectReadingOrder({{R"("area":"A")", "Invalid area 'A'"},
                      {R"("max_size":"1 M")", "Invalid unit 'M'"},
                      {R"("prune_interval":"1 P")", "Invalid unit 'P'"},
                      {R"("session_scoped":[])", "array"},
                      {R"("stores":{"s":{"type":"T"}})", "Invalid type 'T'"}},
                     managerWith);
}

TEST(Configuration, AnUnmanagedStoresKeysAreReadInAFixedOrder) {
  expectReadingOrder({{R"("name":5)", "number"},
                      {R"("locale_sensitive":"x")", "string"},
                      {R"("has_version":null)", "null"},
                      {R"("version":[])", "array"},
                      {R"("is_cache":{})", "object"},
                      {R"("max_size":"1 M")", "Invalid unit 'M'"}},
                     [](const string& members) { return storeWith(R"("type":"unmanaged",)" + members); });
}

TEST(Configuration, AStoresNameIsReadBeforeItsTypeAndTheTypeBeforeTheRest) {
  expectReadingOrder(
      {{R"("name":5)", "number"}, {R"("type":"T")", "Invalid type 'T'"}, {R"("locale_sensitive":[])", "type"}},
      storeWith);
}

TEST(Configuration, AKeyValueStoresKeysAreReadInAFixedOrder) {
  expectReadingOrder(
      {{R"("version":[])", "array"}, {R"("inline_data":{})", "object"}, {R"("stale_age":"1 S")", "Invalid unit 'S'"}},
      [](const string& members) { return storeWith(R"("type":"pkvs",)" + members); });
}

TEST(Configuration, ADiskCachesKeysAreReadInAFixedOrder) {
  expectReadingOrder({{R"("version":[])", "array"},
                      {R"("inline_data":{})", "object"},
                      {R"("stale_age":"1 S")", "Invalid unit 'S'"},
                      {R"("lru_size_limit":"1 L")", "Invalid unit 'L'"},
                      {R"("survival_size":"1 V")", "Invalid unit 'V'"},
                      {R"("metadata_factory":"F")", "Invalid factory 'F'"},
                      {R"("prune_strategy":"P")", "Invalid prune 'P'"}},
                     [](const string& members) { return storeWith(R"("type":"disk_cache",)" + members); });
}

TEST(Configuration, TextsMustBeTexts) {
  for (const char* value : {"5", "1.5", "true", "null", "[]", R"(["caches"])", "{}"}) {
    const string wrong = value;
    for (const char* key : {"area", "max_size", "prune_interval"}) {
      EXPECT_TRUE(isTypeError(managerWith(quoted(key) + ":" + wrong))) << key << " " << value;
    }
    for (const char* key :
         {"name", "stale_age", "lru_size_limit", "survival_size", "metadata_factory", "prune_strategy"}) {
      EXPECT_TRUE(isTypeError(storeWith(R"("type":"disk_cache",)" + quoted(key) + ":" + wrong))) << key << " " << value;
    }
    EXPECT_TRUE(isTypeError(storeWith(R"("type":)" + wrong))) << value;
    EXPECT_TRUE(isTypeError(storeWith(R"("type":"unmanaged","max_size":)" + wrong))) << value;
  }
}

TEST(Configuration, BooleansMustBeBooleans) {
  for (const char* value : {"0", "1", "1.0", R"("true")", R"("")", "null", "[]", "{}"}) {
    const string wrong = value;
    EXPECT_TRUE(isTypeError(managerWith(R"("session_scoped":)" + wrong))) << value;
    for (const char* key : {"locale_sensitive", "has_version", "is_cache"}) {
      EXPECT_TRUE(isTypeError(storeWith(R"("type":"unmanaged",)" + quoted(key) + ":" + wrong))) << key << " " << value;
    }
    EXPECT_TRUE(isTypeError(storeWith(R"("type":"pkvs","inline_data":)" + wrong))) << value;
    EXPECT_TRUE(isTypeError(storeWith(R"("type":"disk_cache","inline_data":)" + wrong))) << value;
  }
}

TEST(Configuration, AVersionMustBeAnInteger) {
  for (const char* value :
       {"1.5", "1.0", "1e2", "99999999999999999999", "true", "false", R"("1")", "null", "[]", "[1]", "{}"}) {
    EXPECT_TRUE(isTypeError(storeWith(string(R"("type":"pkvs","version":)") + value))) << value;
  }
}

TEST(Configuration, TheDocumentItsManagersAndItsStoresMustBeObjects) {
  for (const char* value : {"[]", "[{}]", R"("text")", "5", "1.5", "true", "null"}) {
    const string wrong = value;
    EXPECT_TRUE(isTypeError(wrong)) << value;
    EXPECT_TRUE(isTypeError(R"({"m":)" + wrong + "}")) << value;
    EXPECT_TRUE(isTypeError(managerWith(R"("stores":{"s":)" + wrong + "}"))) << value;
  }
}

TEST(Configuration, TextThatIsNoJsonIsTheJsonLibrarysParseError) {
  for (const string& json : {string(), string(" "), string("{"), string("{}}"), string("{} x"), string(R"({"m":})"),
                             string(R"({"m":{},})"), string("{/*comment*/}"), string("{'m':{}}"),
                             string("{\"m\xff\":{}}"), string("{\"a\nb\":{}}"), string(R"({m:{}})"), string("nul"),
                             string(R"({"m":{"max_size":"\ud800"}})"), string(R"({"m":{"version":01}})")}) {
    EXPECT_TRUE(throws<JsonValue::parse_error>(json)) << json;
  }
}

TEST(Configuration, ANumberThatNoDoubleHoldsIsTheJsonLibrarysError) {
  EXPECT_TRUE(throws<JsonValue::exception>(managerWith(R"("unknown":1e999)")));
}

TEST(Configuration, AParseErrorIsReportedBeforeAnyOtherFault) {
  EXPECT_TRUE(throws<JsonValue::parse_error>(R"({"m":{"area":"bad"},"m":{})"));
}

TEST(Configuration, HostileNestingNeitherCrashesNorHangs) {
  constexpr std::size_t depth = 100000;
  const string arrays = string(depth, '[') + string(depth, ']');
  string objects;
  for (std::size_t i = 0; i < depth; ++i) objects += R"({"a":)";
  objects += "1" + string(depth, '}');
  EXPECT_TRUE(throws<JsonValue::parse_error>(string(depth, '[')));
  EXPECT_TRUE(throws<JsonValue::parse_error>(objects.substr(0, objects.size() / 2)));
  EXPECT_TRUE(isTypeError(arrays));
  EXPECT_TRUE(isTypeError(managerWith(R"("area":)" + arrays)));
  EXPECT_EQ(manager(R"("unknown":)" + objects)->maxSize, 20971520U);
  EXPECT_TRUE(manager(R"("stores":)" + arrays)->stores.empty());
  EXPECT_EQ(pkvs(R"(,"capacity":)" + objects)->capacity, std::nullopt);
  EXPECT_EQ(pkvs(R"(,"unknown":)" + arrays + R"(,"name":"after")")->name, "after");
  EXPECT_TRUE(throws<JsonValue::out_of_range>(managerWith(R"("stores":)" + objects)));
  EXPECT_EQ(Configuration(objects).getManager("a")->maxSize, 20971520U);
}

TEST(Configuration, WhatIsNestedInAnIgnoredValueIsNoMemberOfTheManagerOrStore) {
  EXPECT_EQ(manager(R"("unknown":{"max_size":"1B","stores":{"s":{}}},"area":"shared")")->maxSize, 20971520U);
  EXPECT_EQ(manager(R"("stores":[{"area":"bad"}],"max_size":"1B")")->maxSize, 1U);
  EXPECT_EQ(pkvs(R"(,"unknown":[{"name":"inner"},[{"stale_age":1}]])")->name, "s");
}

TEST(Configuration, ADocumentOfManyManagersAndStoresIsReadWhole) {
  string json;
  for (int m = 0; m < 100; ++m) {
    string stores;
    for (int s = 0; s < 20; ++s) {
      stores += (s == 0 ? "" : ",") + quoted(std::to_string(m) + "/" + std::to_string(s)) + R"(:{"type":"pkvs"})";
    }
    json += (m == 0 ? "" : ",") + quoted(std::to_string(m)) + R"(:{"stores":{)" + stores + "}}";
  }
  const Configuration configuration("{" + json + "}");
  for (int m = 0; m < 100; ++m) {
    EXPECT_EQ(configuration.getManager(std::to_string(m))->stores.size(), 20U);
    EXPECT_EQ(configuration.getStore(std::to_string(m) + "/19")->managerName, std::to_string(m));
  }
}

// Ready definitions

std::shared_ptr<const StoreManagerDefinition> definitionOf(const string& name,
                                                           const std::shared_ptr<const StoreDefinition>& s) {
  return std::make_shared<const StoreManagerDefinition>(
      StoreManagerDefinition{name, Area::Shared, 1, 2, {{"s", s}}, false});
}

std::shared_ptr<const StoreDefinition> someStore(const string& managerName) {
  return std::make_shared<const UnmanagedStoreDefinition>("s", managerName, false, false, 1U, 0U, false);
}

TEST(Configuration, TakesReadyDefinitionsAsTheyAre) {
  std::unordered_map<string, std::shared_ptr<const StoreManagerDefinition>> managers;
  managers["key"] = definitionOf("another name", someStore("a"));
  const Configuration configuration(managers);
  EXPECT_EQ(configuration.getManager("key"), managers.at("key"));
  EXPECT_EQ(configuration.getStore("s"), managers.at("key")->stores.at("s"));
  EXPECT_THROW(configuration.getManager("another name"), ConfigurationException);
}

TEST(Configuration, KeepsItsOwnCopyOfTheReadyDefinitions) {
  std::unordered_map<string, std::shared_ptr<const StoreManagerDefinition>> managers;
  managers["a"] = definitionOf("a", someStore("a"));
  const Configuration configuration(managers);
  managers.clear();
  EXPECT_EQ(configuration.getManager("a")->name, "a");
}

TEST(Configuration, ReadyDefinitionsMayShareAStoreIdentifier) {
  std::unordered_map<string, std::shared_ptr<const StoreManagerDefinition>> managers;
  managers["a"] = definitionOf("a", someStore("a"));
  managers["b"] = definitionOf("b", someStore("b"));
  const Configuration configuration(managers);
  const string found = configuration.getStore("s")->managerName;
  EXPECT_TRUE(found == "a" || found == "b") << found;
  EXPECT_EQ(configuration.getManager("a")->stores.at("s")->managerName, "a");
  EXPECT_EQ(configuration.getManager("b")->stores.at("s")->managerName, "b");
}

TEST(Configuration, ASubclassMaySupplyDefinitionsDifferently) {
  class Substitute : public Configuration {
   public:
    using Configuration::Configuration;
    std::shared_ptr<const StoreDefinition> getStore(const string& identifier) const override {
      return someStore(identifier);
    }
    std::shared_ptr<const StoreManagerDefinition> getManager(const string& name) const override {
      return definitionOf(name, nullptr);
    }
  };
  const Substitute substitute("{}");
  const Configuration& configuration = substitute;
  EXPECT_EQ(configuration.getStore("any")->managerName, "any");
  EXPECT_EQ(configuration.getManager("any")->name, "any");
}

TEST(Configuration, LookupsMayRunOnSeveralThreads) {
  const Configuration configuration(storeWith(R"("type":"pkvs")"));
  test::runOnThreads(4, [&] {
    for (int i = 0; i < 100; ++i) {
      if (configuration.getManager("m")->stores.at("s") != configuration.getStore("s"))
        throw std::logic_error("mixed up");
    }
  });
}

// Definitions

TEST(StoreDefinition, TheNumbersOfTheEnumerationsAreFixed) {
  EXPECT_EQ(static_cast<int>(StoreDefinition::Type::Unmanaged), 0);
  EXPECT_EQ(static_cast<int>(StoreDefinition::Type::PKVS), 1);
  EXPECT_EQ(static_cast<int>(StoreDefinition::Type::DiskCache), 2);
  EXPECT_EQ(static_cast<int>(PruneStrategyIdentifier::LRU), 0);
  EXPECT_EQ(static_cast<int>(PruneStrategyIdentifier::Null), 1);
  EXPECT_EQ(static_cast<int>(PruneStrategyIdentifier::VideoDownload), 2);
  EXPECT_EQ(static_cast<int>(ExtendedMetadataFactoryIdentifier::Null), 0);
  EXPECT_EQ(static_cast<int>(ExtendedMetadataFactoryIdentifier::VideoDownload), 1);
  EXPECT_EQ(static_cast<int>(Area::Caches), 0);
  EXPECT_EQ(static_cast<int>(Area::Documents), 1);
  EXPECT_EQ(static_cast<int>(Area::Shared), 2);
}

TEST(StoreDefinition, AnUnmanagedDefinitionIsBuiltFromItsFields) {
  const UnmanagedStoreDefinition definition("n", "m", true, false, 3, 4, true);
  EXPECT_EQ(definition.type, StoreDefinition::Type::Unmanaged);
  EXPECT_EQ(definition.name, "n");
  EXPECT_EQ(definition.managerName, "m");
  EXPECT_TRUE(definition.localeSensitive);
  EXPECT_FALSE(definition.hasVersion);
  EXPECT_EQ(definition.version, 3U);
  EXPECT_EQ(definition.maxSize, 4U);
  EXPECT_TRUE(definition.isCache);
  EXPECT_FALSE(definition.isManaged);
}

TEST(StoreDefinition, AKeyValueDefinitionIsBuiltFromItsFields) {
  const PKVSDefinition definition("n", "m", false, true, 3, 5, true, 6);
  EXPECT_EQ(definition.type, StoreDefinition::Type::PKVS);
  EXPECT_FALSE(definition.localeSensitive);
  EXPECT_TRUE(definition.hasVersion);
  EXPECT_EQ(definition.maxSize, 0U);
  EXPECT_FALSE(definition.isCache);
  EXPECT_TRUE(definition.isManaged);
  EXPECT_EQ(definition.capacity, 5);
  EXPECT_TRUE(definition.inlineData);
  EXPECT_EQ(definition.staleAge, 6U);
}

TEST(StoreDefinition, ADiskCacheDefinitionIsBuiltFromItsFields) {
  const DiskCacheDefinition definition("n", "m", false, false, 1, std::nullopt, 6, true, 7, 8,
                                       ExtendedMetadataFactoryIdentifier::VideoDownload, PruneStrategyIdentifier::LRU);
  EXPECT_EQ(definition.type, StoreDefinition::Type::DiskCache);
  EXPECT_EQ(definition.capacity, std::nullopt);
  EXPECT_EQ(definition.staleAge, 6U);
  EXPECT_TRUE(definition.inlineData);
  EXPECT_EQ(definition.lruSizeLimit, 7U);
  EXPECT_EQ(definition.maxSize, 7U);
  EXPECT_EQ(definition.survivalSize, 8U);
  EXPECT_TRUE(definition.isCache);
  EXPECT_TRUE(definition.isManaged);
  EXPECT_EQ(definition.metadataFactory, ExtendedMetadataFactoryIdentifier::VideoDownload);
  EXPECT_EQ(definition.pruneStrategy, PruneStrategyIdentifier::LRU);
}

TEST(StoreDefinition, IsAbstract) { EXPECT_TRUE(std::is_abstract_v<StoreDefinition>); }

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
