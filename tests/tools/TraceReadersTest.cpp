#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdint>
#include <sstream>
#include <string>
#include <vector>

#include "AnalyticsEventReporter.h"
#include "InputError.h"
#include "host/JsonLinesAnalytics.h"
#include "support/TemporaryDirectory.h"
#include "tune/CsvReader.h"
#include "tune/EventReader.h"
#include "tune/LineReader.h"
#include "tune/Trace.h"

namespace velmora::mobile::xplat::cellar::tools {
namespace {

using testing::ElementsAre;
using testing::IsEmpty;
using testing::Pair;
using Hit = PersistentKeyValueStoreEvent::Hit;

class TraceReadersTest : public testing::Test {
 protected:
  // Each access as "kind key size".
  static std::vector<std::string> linesOf(const Trace& trace) {
    std::vector<std::string> lines;
    trace.replay([&](const Access& access) {
      const char* const kinds[] = {"fetch ", "store ", "remove "};
      if (access.kind == AccessKind::Clear) {
        lines.emplace_back("clear");
        return;
      }
      lines.push_back(kinds[static_cast<int>(access.kind)] + std::to_string(access.key) + " " +
                      std::to_string(access.size));
    });
    return lines;
  }

  EventCounts readLines(const std::string& store = "") {
    directory.write("events", lines.str());
    LineReader reader(directory.file("events"));
    return readEvents(reader, store, trace, [] {});
  }

  void readTable(const std::string& text, const CsvColumns& columns) {
    directory.write("table", text);
    LineReader reader(directory.file("table"));
    readCsv(reader, columns, trace, [] {});
  }

  std::string refusalOf(const std::string& text, const CsvColumns& columns) {
    try {
      readTable(text, columns);
      return "";
    } catch (const InputError& error) {
      std::string what = error.what();
      const std::string place = directory.file("table");
      return what.rfind(place, 0) == 0 ? what.substr(place.size()) : what;
    }
  }

  void hit(const std::string& store, const std::string& key, unsigned int size) {
    reporter.reportEvent(PersistentKeyValueStoreEventBuilder(Hit::Found, store, key).size(size).get());
  }
  void miss(const std::string& store, const std::string& key) {
    reporter.reportEvent(PersistentKeyValueStoreEventBuilder(Hit::Missing, store, key).get());
  }

  static CsvColumns columns() {
    CsvColumns names;
    names.key = "lbn";
    names.size = "bytes";
    return names;
  }

  test::TemporaryDirectory directory;
  std::ostringstream lines;
  AnalyticsEventReporter reporter{std::make_unique<host::JsonLinesAnalytics>(lines)};
  Trace trace;
};

TEST_F(TraceReadersTest, AccessesAreReadAsTheReporterAndTheSinkWriteThem) {
  miss("thumbs", "a");
  hit("thumbs", "a", 30);
  hit("drafts", "a", 99);
  reporter.reportEvent(TrashCollectorEvent(std::chrono::milliseconds(5), 1));
  hit("thumbs", "b \"quoted\"", 40);
  const EventCounts counts = readLines("thumbs");
  EXPECT_THAT(counts.accessesOfStores, ElementsAre(Pair("drafts", 1), Pair("thumbs", 3)));
  EXPECT_EQ(counts.hits, 2U);
  EXPECT_EQ(counts.damagedLines, 0U);
  EXPECT_THAT(linesOf(trace), ElementsAre("fetch 0 30", "fetch 0 30", "fetch 1 40"));
}

TEST_F(TraceReadersTest, AHitThatIsTheFirstAccessToItsKeyIsCountedAsWhatWasStoredUnseen) {
  hit("s", "a", 10);
  hit("s", "a", 10);
  miss("s", "b");
  hit("s", "b", 10);
  hit("s", "c", 10);
  const EventCounts counts = readLines();
  EXPECT_EQ(counts.hits, 4U);
  EXPECT_EQ(counts.firstHits, 2U);
}

TEST_F(TraceReadersTest, AMissHasTheSizeLastSeenOrElseTheOneSeenNext) {
  miss("s", "a");
  hit("s", "a", 30);
  miss("s", "a");
  hit("s", "a", 50);
  miss("s", "a");
  readLines();
  EXPECT_THAT(linesOf(trace), ElementsAre("fetch 0 30", "fetch 0 30", "fetch 0 30", "fetch 0 50", "fetch 0 50"));
}

TEST_F(TraceReadersTest, WhatIsNeverFoundHasTheMeanSizeOfTheOthersOrTheOneThatIsSaid) {
  hit("s", "a", 10);
  hit("s", "b", 30);
  miss("s", "c");
  readLines();
  EXPECT_EQ(trace.keysOfUnknownSize(), 1U);
  EXPECT_EQ(trace.assumedSize(), 20);
  EXPECT_THAT(linesOf(trace), ElementsAre("fetch 0 10", "fetch 1 30", "fetch 2 20"));
  trace.assumeSize(7);
  EXPECT_THAT(linesOf(trace), ElementsAre("fetch 0 10", "fetch 1 30", "fetch 2 7"));
}

TEST_F(TraceReadersTest, AHitOfNoBytesIsAnEmptyItemUnlessAnotherHitTellsASize) {
  hit("s", "empty", 0);
  hit("s", "touched", 0);
  hit("s", "touched", 12);
  readLines();
  EXPECT_EQ(trace.keysOfUnknownSize(), 0U);
  EXPECT_THAT(linesOf(trace), ElementsAre("fetch 0 0", "fetch 1 12", "fetch 1 12"));
}

TEST_F(TraceReadersTest, ALineThatIsNoJsonIsCountedAndPassedOver) {
  hit("s", "a", 10);
  lines << "{\"event\":\"qzpkvs_acc\n\n[1]\n";
  hit("s", "a", 10);
  lines << R"({"event":"qzpkvs_access","payload":"no object"})"
        << "\n"
        << R"({"event":"qzpkvs_access","payload":{"store_name":"s","key":"a","hit":"0","size":1}})"
        << "\n";
  EXPECT_EQ(readLines().damagedLines, 2U);
  EXPECT_EQ(trace.accesses(), 2U);
}

TEST_F(TraceReadersTest, ASizeThatNoItemHasIsCountedAndPassedOver) {
  hit("s", "a", 4294967295);
  for (const char* const size : {"4294967296", "576460752303423488", "9223372036854775807"}) {
    lines << R"({"event":"qzpkvs_access","payload":{"store_name":"s","key":"b","hit":0,"size":)" << size << "}}\n";
  }
  EXPECT_EQ(readLines().damagedLines, 3U);
  EXPECT_THAT(linesOf(trace), ElementsAre("fetch 0 4294967295"));
}

TEST_F(TraceReadersTest, ATableIsReadByTheNamesOfItsColumns) {
  readTable("bytes,when,lbn\r\n10,1,x\r\n20,2.5,\"y,\"\"z\"\n\n,61,x\n", [] {
    CsvColumns names = columns();
    names.time = "when";
    return names;
  }());
  EXPECT_THAT(linesOf(trace), ElementsAre("fetch 0 10", "fetch 1 20", "fetch 0 10"));
  EXPECT_EQ(trace.seconds(), 60);
  EXPECT_EQ(trace.keys(), 2U);
}

TEST_F(TraceReadersTest, OperationsThatAreNamedStoreOrRemoveAndAllOthersFetch) {
  CsvColumns names = columns();
  names.op = "op";
  names.stores = {"2a", "set"};
  names.removes = {"del"};
  readTable("op,lbn,bytes\n28,x,1\n2a,x,2\nset,x,3\ndel,x,\nanything,x,4\n", names);
  EXPECT_THAT(linesOf(trace), ElementsAre("fetch 0 1", "store 0 2", "store 0 3", "remove 0 3", "fetch 0 4"));
}

TEST_F(TraceReadersTest, AnOperationThatClearsNeedsNeitherKeyNorSize) {
  CsvColumns names = columns();
  names.op = "op";
  names.time = "when";
  names.clears = {"logout"};
  readTable("op,when,lbn,bytes\n28,1,x,5\nlogout,2,,\n28,3,x,\nlogout,4,y,7\n", names);
  EXPECT_THAT(linesOf(trace), ElementsAre("fetch 0 5", "clear", "fetch 0 5", "clear"));
  EXPECT_EQ(trace.keys(), 1U);
  EXPECT_EQ(trace.seconds(), 3);
}

TEST_F(TraceReadersTest, MetadataOfVideosIsTakenWhereItIs) {
  CsvColumns names = columns();
  names.chunkSecond = "second";
  names.itemType = "type";
  readTable("lbn,bytes,second,type\na,1,,\n", names);
  EXPECT_FALSE(trace.hasMetadata());
  readTable("lbn,bytes,second,type\na,1,-5,\n", names);
  EXPECT_TRUE(trace.hasMetadata());
}

TEST_F(TraceReadersTest, WhatCannotBeReadIsNamedWithItsPlace) {
  EXPECT_EQ(refusalOf("lbn,size\na,1\n", columns()), ":1: there is no column 'bytes'");
  EXPECT_EQ(refusalOf("lbn,bytes\na,1\nb,1x\n", columns()), ":3: '1x' is not a size in bytes");
  EXPECT_EQ(refusalOf("lbn,bytes\na,-1\n", columns()), ":2: '-1' is not a size in bytes");
  EXPECT_EQ(refusalOf("lbn,bytes\na,99999999999999999999\n", columns()),
            ":2: '99999999999999999999' is not a size in bytes");
  EXPECT_EQ(refusalOf("lbn,bytes\na\n", columns()), ":2: there are only 1 cells");
  EXPECT_EQ(refusalOf("lbn,bytes\n", columns()), "");
}

TEST_F(TraceReadersTest, SizesThatCannotBeAddedUpAreRefused) {
  std::string table = "lbn,bytes\n";
  for (int i = 0; i < 1025; ++i) table += "a,1125899906842624\n";
  EXPECT_EQ(refusalOf(table, columns()), ":1026: the sizes add up to more than can be counted");
}

TEST_F(TraceReadersTest, SizesThatAreFilledInAreAddedUpToo) {
  std::string table = "lbn,bytes\na,1125899906842624\n";
  for (int i = 0; i < 1024; ++i) table += "a,\n";
  readTable(table, columns());
  EXPECT_THROW((void)linesOf(trace), InputError);
}

TEST_F(TraceReadersTest, ATimeThatNoClockHasIsNone) {
  for (const char* const time : {"18446744073709551615", "-9223372036854775808", "1125899906842625", "7"}) {
    lines << R"({"event":"qzpkvs_access","payload":{"store_name":"s","key":"k","hit":0,"size":1},"time":)" << time
          << "}\n";
  }
  EXPECT_EQ(readLines().hits, 4U);
  EXPECT_EQ(trace.seconds(), 7);
}

TEST_F(TraceReadersTest, AFileThatIsNotThereIsNamed) {
  try {
    const LineReader reader(directory.file("nothing"));
    FAIL();
  } catch (const InputError& error) {
    EXPECT_EQ(error.what(), "cannot read '" + directory.file("nothing") + "': No such file or directory");
  }
}

TEST_F(TraceReadersTest, AnEmptyFileHasNoAccesses) {
  EXPECT_THAT(readLines().accessesOfStores, IsEmpty());
  EXPECT_EQ(trace.accesses(), 0U);
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar::tools
