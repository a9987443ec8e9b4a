#include "host/JsonLinesAnalytics.h"

#include <gtest/gtest.h>

#include <cerrno>
#include <ios>
#include <memory>
#include <sstream>
#include <streambuf>
#include <string>
#include <vector>

#include "AnalyticsEventReporter.h"
#include "JsonValue.h"
#include "LarderException.h"
#include "support/Barrier.h"
#include "support/Bytes.h"
#include "support/LogCapture.h"
#include "support/TemporaryDirectory.h"

namespace velmora::mobile::xplat::cellar::host {
namespace {

using test::linesOf;
using test::LogCapture;
using test::TemporaryDirectory;

// A device with room for so many bytes; what comes after them fails.
class SmallDisk : public std::streambuf {
 public:
  explicit SmallDisk(std::size_t room) : room_(room) {}
  void makeRoom(std::size_t bytes) { room_ += bytes; }
  const std::string& contents() const { return contents_; }

 private:
  int_type overflow(int_type character) override {
    if (room_ == 0) return traits_type::eof();
    --room_;
    contents_ += traits_type::to_char_type(character);
    return character;
  }

  std::size_t room_;
  std::string contents_;
};

class JsonLinesAnalyticsTest : public testing::Test {
 protected:
  // The line that an event with this payload and time becomes.
  std::string lineFor(const std::string& payload, const std::string& time = "1") {
    std::ostringstream stream;
    JsonLinesAnalytics(stream).logEvent("event", "perf", payload, time);
    return stream.str();
  }
};

TEST_F(JsonLinesAnalyticsTest, AnEventIsOneLineOfJson) {
  std::ostringstream stream;
  JsonLinesAnalytics analytics(stream);
  analytics.logEvent("qztrash_collector", "perf", R"({"time_spent":1.5,"file_count":4})", "1753920000");
  EXPECT_EQ(stream.str(),
            R"({"event":"qztrash_collector","category":"perf","payload":{"time_spent":1.5,"file_count":4},)"
            R"("time":1753920000})"
            "\n");
}

TEST_F(JsonLinesAnalyticsTest, APayloadThatIsNotJsonIsWrittenAsText) {
  EXPECT_EQ(lineFor("not json"), "{\"event\":\"event\",\"category\":\"perf\",\"payload\":\"not json\",\"time\":1}\n");
  EXPECT_EQ(JsonValue::parse(lineFor("")).at("payload"), "");
  EXPECT_EQ(JsonValue::parse(lineFor(R"({"open":)")).at("payload"), R"({"open":)");
}

TEST_F(JsonLinesAnalyticsTest, APayloadThatIsNoObjectIsWrittenAsText) {
  for (const std::string payload : {"[1,2]", "42", "null", "\"text\""}) {
    EXPECT_EQ(JsonValue::parse(lineFor(payload)).at("payload"), payload);
  }
}

TEST_F(JsonLinesAnalyticsTest, ATimeThatIsNoNumberIsWrittenAsText) {
  for (const std::string time : {"", "soon", "12 o'clock", "1.5", "99999999999999999999"}) {
    EXPECT_EQ(JsonValue::parse(lineFor("{}", time)).at("time"), time);
  }
}

TEST_F(JsonLinesAnalyticsTest, NumbersOf64BitsAreKept) {
  const JsonValue line = JsonValue::parse(lineFor(R"({"size":9223372036854775807})", "-5"));
  EXPECT_EQ(line.at("payload").at("size"), 9223372036854775807LL);
  EXPECT_EQ(line.at("time"), -5);
}

TEST_F(JsonLinesAnalyticsTest, LineBreaksInAnEventBreakNoLine) {
  const std::string written = lineFor("two\nlines");
  ASSERT_EQ(linesOf(written).size(), 1U);
  EXPECT_EQ(JsonValue::parse(written).at("payload"), "two\nlines");
}

TEST_F(JsonLinesAnalyticsTest, TextThatIsNotUtf8IsWrittenWithReplacementCharacters) {
  const LogCapture log;
  const std::string replacement = "\xEF\xBF\xBD";
  EXPECT_EQ(JsonValue::parse(lineFor("a\xFFz")).at("payload"), "a" + replacement + "z");
  EXPECT_EQ(log.errorCount(), 0U);
}

TEST_F(JsonLinesAnalyticsTest, EventsOfTheReporterArriveWhole) {
  auto stream = std::make_unique<std::ostringstream>();
  AnalyticsEventReporter reporter(std::make_unique<JsonLinesAnalytics>(*stream));
  reporter.reportEvent(StoreManagerEvent(StoreManagerEvent::Type::Eviction, "thumbs", 4000000000U, 7));
  const JsonValue line = JsonValue::parse(stream->str());
  EXPECT_EQ(line.at("event"), "qzdiskstore_logging");
  EXPECT_EQ(line.at("category"), "perf");
  EXPECT_EQ(line.at("payload"),
            (JsonValue{
                {"event_type", "eviction"}, {"store_name", "thumbs"}, {"current_size", 4000000000U}, {"max_size", 7}}));
  EXPECT_TRUE(line.at("time").is_number_integer());
}

TEST_F(JsonLinesAnalyticsTest, LinesOfManyThreadsNeverMix) {
  std::ostringstream stream;
  JsonLinesAnalytics analytics(stream);
  test::runOnThreads(4, [&](std::size_t thread) {
    for (int i = 0; i < 100; ++i) analytics.logEvent(std::to_string(thread), "perf", "{}", std::to_string(i));
  });
  std::vector<int> next(4, 0);
  for (const std::string& line : linesOf(stream.str())) {
    const JsonValue event = JsonValue::parse(line);
    const std::size_t thread = std::stoul(event.at("event").get<std::string>());
    EXPECT_EQ(event.at("time"), next.at(thread)++);
  }
  EXPECT_EQ(next, (std::vector<int>{100, 100, 100, 100}));
}

TEST_F(JsonLinesAnalyticsTest, AFileIsCreatedAndAppendedTo) {
  const TemporaryDirectory directory;
  JsonLinesAnalytics(directory.file("events")).logEvent("first", "perf", "{}", "1");
  JsonLinesAnalytics(directory.file("events")).logEvent("second", "perf", "{}", "2");
  EXPECT_EQ(directory.read("events"),
            "{\"event\":\"first\",\"category\":\"perf\",\"payload\":{},\"time\":1}\n"
            "{\"event\":\"second\",\"category\":\"perf\",\"payload\":{},\"time\":2}\n");
}

TEST_F(JsonLinesAnalyticsTest, ALineIsInTheFileAsSoonAsItIsLogged) {
  const TemporaryDirectory directory;
  JsonLinesAnalytics analytics(directory.file("events"));
  analytics.logEvent("event", "perf", "{}", "1");
  EXPECT_EQ(linesOf(directory.read("events")).size(), 1U);
}

TEST_F(JsonLinesAnalyticsTest, TwoSinksOnOneFileMixNoLines) {
  const TemporaryDirectory directory;
  test::runOnThreads(2, [&] {
    JsonLinesAnalytics analytics(directory.file("events"));
    for (int i = 0; i < 100; ++i) analytics.logEvent(std::string(300, 'x'), "perf", "{}", "1");
  });
  const std::vector<std::string> lines = linesOf(directory.read("events"));
  ASSERT_EQ(lines.size(), 200U);
  for (const std::string& line : lines) EXPECT_TRUE(JsonValue::accept(line)) << line;
}

TEST_F(JsonLinesAnalyticsTest, AFileThatCannotBeOpenedThrows) {
  const TemporaryDirectory directory;
  try {
    const JsonLinesAnalytics analytics(directory.file("missing/events"));
    FAIL() << "There is no such directory.";
  } catch (const FileUtilsIoException& error) {
    EXPECT_EQ(error.code(), ENOENT);
    EXPECT_STREQ(error.description(), "Could not open file: No such file or directory");
  }
}

#if defined(__linux__)
TEST_F(JsonLinesAnalyticsTest, AFullDiskIsLoggedOnceAndNothingIsThrown) {
  const LogCapture log;
  JsonLinesAnalytics analytics(std::string("/dev/full"));
  for (int i = 0; i < 3; ++i) EXPECT_NO_THROW(analytics.logEvent("event", "perf", "{}", "1"));
  EXPECT_EQ(log.messages(), std::vector<std::string>{"Cannot write analytics to '/dev/full': No space left on device"});
}
#endif

TEST_F(JsonLinesAnalyticsTest, AStreamThatFailsIsLoggedOnce) {
  const LogCapture log;
  SmallDisk disk(0);
  std::ostream stream(&disk);
  JsonLinesAnalytics analytics(stream);
  for (int i = 0; i < 3; ++i) analytics.logEvent("event", "perf", "{}", "1");
  EXPECT_EQ(log.messages(), std::vector<std::string>{"Cannot write analytics to a stream: stream failed"});
}

TEST_F(JsonLinesAnalyticsTest, AStreamThatThrowsIsLoggedOnce) {
  const LogCapture log;
  SmallDisk disk(0);
  std::ostream stream(&disk);
  stream.exceptions(std::ios::badbit);
  JsonLinesAnalytics analytics(stream);
  for (int i = 0; i < 3; ++i) EXPECT_NO_THROW(analytics.logEvent("event", "perf", "{}", "1"));
  EXPECT_EQ(log.errorCount(), 1U);
  EXPECT_TRUE(log.contains("Cannot write analytics to a stream: "));
}

TEST_F(JsonLinesAnalyticsTest, AfterAFailureLinesBeginOnALineOfTheirOwnAndTheNextFailureIsLoggedAgain) {
  const LogCapture log;
  SmallDisk disk(10);
  std::ostream stream(&disk);
  JsonLinesAnalytics analytics(stream);
  analytics.logEvent("lost", "perf", "{}", "1");
  const std::string kept = "{\"event\":\"kept\",\"category\":\"perf\",\"payload\":{},\"time\":2}\n";
  disk.makeRoom(1 + kept.size());
  analytics.logEvent("kept", "perf", "{}", "2");
  EXPECT_EQ(disk.contents(), "{\"event\":\"\n" + kept);
  EXPECT_EQ(log.errorCount(), 1U);
  analytics.logEvent("lost again", "perf", "{}", "3");
  EXPECT_EQ(log.errorCount(), 2U);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::host
