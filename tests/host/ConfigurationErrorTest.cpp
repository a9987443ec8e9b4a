// What a host says about a configuration that it refuses.

#include <gtest/gtest.h>

#include <stdexcept>
#include <string>
#include <vector>

#include "Configuration.h"
#include "JsonValue.h"
#include "LarderException.h"
#include "host/Errors.h"
#include "host/Host.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using std::string;

// "pointer line:column", of the refusal of a host, which is also checked for what is the same for all.
string placeOf(const string& configuration) {
  const test::TemporaryDirectory directory;
  try {
    const Host host(configuration, directory.path());
  } catch (const ConfigurationError& error) {
    const auto* const standard = dynamic_cast<const std::exception*>(&error);
    EXPECT_EQ(standard == nullptr ? "not a standard exception" : standard->what(), error.text());
    try {
      error.rethrow_nested();
    } catch (const ConfigurationError&) {
      ADD_FAILURE() << "The original is the library's own.";
    } catch (const std::exception& original) {
      const string place = (error.pointer().empty() ? "" : ", " + error.pointer()) + ", line " +
                           std::to_string(error.line()) + ", column " + std::to_string(error.column()) + ": ";
      EXPECT_EQ(error.text(), "Configuration" + place + original.what());
    }
    return error.pointer() + " " + std::to_string(error.line()) + ":" + std::to_string(error.column());
  }
  return "no error";
}

string ofStore(const string& members) {
  return placeOf("{\"m\": {\"stores\": {\"s\": {\n\"type\": \"disk_cache\"" + members + "}}}}");
}

template <class Error> void expectThrows(const string& configuration) {
  const test::TemporaryDirectory directory;
  EXPECT_THROW(Host(configuration, directory.path()), Error) << configuration;
  EXPECT_THROW(Host(configuration, directory.path()), std::exception) << configuration;
  EXPECT_THROW(Host(configuration, directory.path()), ConfigurationError) << configuration;
  EXPECT_THROW(Configuration{configuration}, Error) << configuration;  // so it is where the library throws it
}

TEST(ConfigurationError, NamesPointerLineAndColumnOfAValue) {
  const string configuration = R"({
  "media": {
    "area": "caches",
    "stores": {
      "thumbs": {"type": "unmanaged",
        "max_size" : "20mb"}
    }
  }
})";
  EXPECT_EQ(placeOf(configuration), "/media/stores/thumbs/max_size 6:22");
}

TEST(ConfigurationError, IsWhatTheLibraryThrowsToo) {
  expectThrows<std::invalid_argument>(R"({"m": {"area": "nowhere"}})");
  expectThrows<ConfigurationException>(R"({"m": {}, "m": {}})");
  expectThrows<JsonValue::parse_error>("{");
  expectThrows<JsonValue::type_error>(R"({"m": {"max_size": 3}})");
  expectThrows<JsonValue::type_error>("[]");
  expectThrows<JsonValue::out_of_range>(R"({"m": {"stores": {"s": {}}}})");
  expectThrows<JsonValue::out_of_range>(R"({"m": {"max_size": 1e999}})");
}

TEST(ConfigurationError, HasTheCodeTheDescriptionAndTheIdOfTheOriginal) {
  const test::TemporaryDirectory directory;
  try {
    const Host host(R"({"m": {}, "m": {}})", directory.path());
    FAIL();
  } catch (const ConfigurationException& error) {
    EXPECT_STREQ(error.domain(), "QZConfigurationErrorDomain");
    EXPECT_STREQ(error.description(), "Duplicate store manager definition.");
    EXPECT_STREQ(error.what(),
                 "Configuration, /m, line 1, column 11: domain: QZConfigurationErrorDomain; code: 0; description: "
                 "Duplicate store manager definition. .");
  }
  try {
    const Host host("{\n?", directory.path());
    FAIL();
  } catch (const JsonValue::parse_error& error) {
    EXPECT_EQ(error.id, 101);
    EXPECT_EQ(error.byte, 3U);
  }
}

TEST(ConfigurationError, FindsValuesOfManagers) {
  EXPECT_EQ(placeOf(R"({"m": {"area": "nowhere"}})"), "/m/area 1:16");
  EXPECT_EQ(placeOf(R"({"m": {"max_size": "1TB"}})"), "/m/max_size 1:20");
  EXPECT_EQ(placeOf(R"({"m": {"prune_interval": "1 second"}})"), "/m/prune_interval 1:26");
  EXPECT_EQ(placeOf(R"({"m": {"session_scoped": 1}})"), "/m/session_scoped 1:26");
  EXPECT_EQ(placeOf(R"({"a": {}, "m": 7})"), "/m 1:16");
}

TEST(ConfigurationError, FindsValuesOfStores) {
  EXPECT_EQ(placeOf(R"({"m": {"stores": {"s": []}}})"), "/m/stores/s 1:24");
  EXPECT_EQ(placeOf(R"({"m": {"stores": {"s": {}}}})"), "/m/stores/s 1:24");
  EXPECT_EQ(placeOf(R"({"m": {"stores": {"s": {"name": 1}}}})"), "/m/stores/s/name 1:33");
  EXPECT_EQ(placeOf(R"({"m": {"stores": {"s": {"type": "disk"}}}})"), "/m/stores/s/type 1:33");
  EXPECT_EQ(placeOf(R"({"m": {"stores": {"s": {"type": null}}}})"), "/m/stores/s/type 1:33");
  const std::vector<string> keys = {"name",        "locale_sensitive", "has_version",    "version",
                                    "inline_data", "stale_age",        "lru_size_limit", "survival_size",
                                    "durability",  "metadata_factory", "prune_strategy"};
  for (const string& key : keys) {
    EXPECT_EQ(ofStore(",\n \"" + key + "\":\t[]"), "/m/stores/s/" + key + " 3:" + std::to_string(key.size() + 6));
  }
  EXPECT_EQ(ofStore(R"(, "capacity": [])"), "no error");
}

TEST(ConfigurationError, FindsTheOneOfSeveralFaultsThatTheLibraryReports) {
  EXPECT_EQ(placeOf(R"({"m": {"max_size": "2mb", "area": "x"}})"), "/m/area 1:35");
  EXPECT_EQ(placeOf(R"({"a": {"stores": {"s": {"type": "pkvs"}}}, "b": {"area": "x", "stores": {"s": 7}}})"),
            "/b/area 1:58");
  EXPECT_EQ(placeOf(R"({"a": {"area": "x"}, "a": {"area": "y"}})"), "/a/area 1:16");
  EXPECT_EQ(placeOf(R"({"m": {"stores": {"s": {"name": 7}, "s": {}}}})"), "/m/stores/s/name 1:33");
}

TEST(ConfigurationError, FindsNamesThatAreUsedTwice) {
  EXPECT_EQ(placeOf("{\"m\": {},\n\"m\": {}}"), "/m 2:1");
  EXPECT_EQ(placeOf(R"({"m": {"stores": {"s": {"type": "pkvs"}, "s": {"type": "pkvs"}}}})"), "/m/stores/s 1:42");
  EXPECT_EQ(placeOf(R"({"m": {"stores": {"s": {"type": "pkvs"}}}, "n": {"stores": {"s": {"type": "pkvs"}}}})"),
            "/n/stores/s 1:61");
}

TEST(ConfigurationError, OfAKeyThatIsThereTwiceTheLastOneCounts) {
  EXPECT_EQ(placeOf(R"({"m": {"area": "x", "area": "caches"}})"), "no error");
  EXPECT_EQ(placeOf(R"({"m": {"area": "caches", "area": "x"}})"), "/m/area 1:34");
  EXPECT_EQ(placeOf(R"({"m": {"stores": {"s": 7}, "stores": {}}})"), "no error");
}

TEST(ConfigurationError, FindsManagersThatWouldShareADirectory) {
  EXPECT_EQ(placeOf("{\"b\": {},\n  \"a\": {}}"), "/a 2:8");
  EXPECT_EQ(placeOf(R"({"m": {}, "n~/": {"area": "caches"}})"), "/n~0~1 1:18");
}

TEST(ConfigurationError, TakesNamesAsTheyAreWritten) {
  EXPECT_EQ(placeOf(R"({"a/b~": {"area": 1}})"), "/a~1b~0/area 1:19");
  EXPECT_EQ(placeOf(R"({"\u0061\"\\": {"area": 1}})"), "/a\"\\/area 1:25");
  EXPECT_EQ(placeOf(R"({"m": {"\u0061rea": 1}})"), "/m/area 1:21");
  EXPECT_EQ(placeOf(R"({"}": {"{": ["}", {"]": "\""}], "area": 1}})"), "/}/area 1:41");
  EXPECT_EQ(placeOf("\xef\xbb\xbf{\"m\":1}"), "/m 1:9");
}

TEST(ConfigurationError, CountsLinesByLineFeeds) {
  EXPECT_EQ(placeOf("{\r\n\r\n \"m\":1}"), "/m 3:6");
  EXPECT_EQ(placeOf("\n\n[]"), " 3:1");
}

TEST(ConfigurationError, SaysWhereATextStopsToBeJson) {
  EXPECT_EQ(placeOf(""), " 1:1");
  EXPECT_EQ(placeOf("{\n  \"m\": ?}"), " 2:8");
  EXPECT_EQ(placeOf("{} x"), " 1:4");
  EXPECT_EQ(placeOf("{\"m\": {}"), " 1:9");
  EXPECT_EQ(placeOf("{\"\xff\": 1}"), " 1:3");
}

// Whatever is cut off a document or put in its place, there is an error with a place inside it, or none at all.
TEST(ConfigurationError, HasAPlaceInAnyBrokenDocument) {
  const string good =
      R"({"m\u0041": {"max_size": "1MB", "x": [{"a": 1e3}], "stores": {"s": {"type": "pkvs", "b": "\\"}}}})";
  ASSERT_EQ(placeOf(good), "no error");
  for (std::size_t i = 0; i < good.size(); ++i) {
    EXPECT_NE(placeOf(good.substr(0, i)), "no error") << i;
    for (const char character : {'"', '\\', '{', '}', '[', ',', '9', '\0'}) {
      string broken = good;
      broken[i] = character;
      const bool isRefused = [&] {
        try {
          const Configuration configuration(broken);
          return false;
        } catch (const std::exception&) {
          return true;
        }
      }();
      EXPECT_EQ(placeOf(broken) != "no error", isRefused) << broken;
    }
  }
}

TEST(ConfigurationError, ADeepDocumentIsNoProblem) {
  const string deep = string(100'000, '[') + string(100'000, ']');
  EXPECT_EQ(placeOf(R"({"m": {"x": )" + deep + R"(, "area": 1}})"), "/m/area 1:200023");
  EXPECT_EQ(placeOf(R"({"m": )" + deep + "}"), "/m 1:7");
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
