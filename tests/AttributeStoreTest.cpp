#include "AttributeStore.h"

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <limits>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include "JsonValue.h"
#include "host/testing/FaultyFileUtils.h"
#include "support/LogCapture.h"
#include "support/TemporaryDirectory.h"
#include "support/Watchdog.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using std::string;
using test::Operation;

const string kFileName = "_cellar_extended_attributes";

class AttributeStoreTest : public testing::Test {
 protected:
  string ioFailure(int code, const string& text) {
    return "domain: QZLarderIoErrorErrorDomain; code: " + std::to_string(code) + "; description: " + text + " .";
  }

  test::TemporaryDirectory directory_;
  std::shared_ptr<test::FaultyFileUtils> files_ = std::make_shared<test::FaultyFileUtils>();
  AttributeStore store_{files_};
  test::LogCapture log_;
};

TEST_F(AttributeStoreTest, GettingFromADirectoryWithoutTheFileGivesAnEmptyObjectAndLogsNothing) {
  EXPECT_EQ(store_.get(directory_.path()), JsonValue::object());
  EXPECT_TRUE(log_.messages().empty());
  EXPECT_EQ(files_->calls(Operation::ReadFile), 0U);
}

TEST_F(AttributeStoreTest, WhatIsSetIsGottenBack) {
  const JsonValue value = {{"number", 1}, {"big", 9007199254740993LL}, {"half", 0.5}, {"list", {1, "two", nullptr}}};
  store_.set(directory_.path(), value);
  EXPECT_EQ(store_.get(directory_.path()), value);
  EXPECT_TRUE(log_.messages().empty());
}

TEST_F(AttributeStoreTest, TheFileHoldsCompactTextInsideTheDirectoryAndNothingElse) {
  store_.set(directory_.path(), {{"key", "value"}});
  EXPECT_EQ(directory_.names(), std::vector<string>{kFileName});
  EXPECT_EQ(directory_.read(kFileName), R"({"key":"value"})");
}

TEST_F(AttributeStoreTest, TheFileIsWrittenInOnePiece) {
  store_.set(directory_.path(), {{"a", 1}, {"b", 2}});
  EXPECT_EQ(files_->calls(Operation::WriteFile), 1U);
}

TEST_F(AttributeStoreTest, SettingReplacesTheWholeDocument) {
  store_.set(directory_.path(), {{"old", "a rather long value that the next one does not cover"}});
  store_.set(directory_.path(), {{"new", 1}});
  EXPECT_EQ(store_.get(directory_.path()), (JsonValue{{"new", 1}}));
}

TEST_F(AttributeStoreTest, SettingOnAMissingDirectoryWritesNothingAndLogsNothing) {
  store_.set(directory_.file("missing"), {{"key", 1}});
  EXPECT_TRUE(directory_.names().empty());
  EXPECT_EQ(store_.get(directory_.file("missing")), JsonValue::object());
  EXPECT_TRUE(log_.messages().empty());
  EXPECT_EQ(files_->calls(Operation::WriteFile), 0U);
}

TEST_F(AttributeStoreTest, SettingOnARegularFileWritesNothing) {
  const string path = directory_.write("file", "content");
  store_.set(path, {{"key", 1}});
  EXPECT_EQ(directory_.read("file"), "content");
  EXPECT_EQ(files_->calls(Operation::WriteFile), 0U);
  EXPECT_TRUE(log_.messages().empty());
}

TEST_F(AttributeStoreTest, ValuesThatAreNoObjectsComeBackUnchanged) {
  for (const JsonValue& value : {JsonValue(17), JsonValue("text"), JsonValue(nullptr), JsonValue(true), JsonValue(0.1),
                                 JsonValue::array({1, 2}), JsonValue::object(), JsonValue::array()}) {
    store_.set(directory_.path(), value);
    const JsonValue gotten = store_.get(directory_.path());
    EXPECT_EQ(gotten, value);
    EXPECT_EQ(gotten.type_name(), string(value.type_name())) << value;
  }
  EXPECT_TRUE(log_.messages().empty());
}

TEST_F(AttributeStoreTest, ADamagedFileIsReadAsNoAttributesAndLogged) {
  directory_.write(kFileName, "no json");
  EXPECT_EQ(store_.get(directory_.path()), JsonValue::object());
  ASSERT_EQ(log_.errorCount(), 1U);
  const string message = log_.messages().front();
  const string prefix = "Read invalid json from disk: ";
  EXPECT_EQ(message.substr(0, prefix.size()), prefix);
  EXPECT_GT(message.size(), prefix.size());
  EXPECT_EQ(log_.lines().front().file, "AttributeStore.cpp");
}

TEST_F(AttributeStoreTest, NoKindOfDamageEscapes) {
  const std::vector<string> damaged = {
      "",         "{",     R"({"a":1)",         R"({"a":1} trailing)", string("\0\0\0", 3),
      "\xff\xfe", "1e999", string(100000, '['), "\xEF\xBB\xBF"};
  for (std::size_t i = 0; i < damaged.size(); ++i) {
    directory_.write(kFileName, damaged[i]);
    EXPECT_EQ(store_.get(directory_.path()), JsonValue::object()) << i;
    EXPECT_EQ(log_.errorCount(), i + 1) << i;
    EXPECT_NE(log_.messages().back().find("Read invalid json from disk: "), string::npos) << i;
  }
}

TEST_F(AttributeStoreTest, ADocumentNestedVeryDeeplyIsReadWithoutACrash) {
  constexpr std::size_t depth = 100000;
  directory_.write(kFileName, string(depth, '[') + string(depth, ']'));
  EXPECT_TRUE(store_.get(directory_.path()).is_array());
}

TEST_F(AttributeStoreTest, ADamagedFileIsOverwrittenByTheNextSet) {
  directory_.write(kFileName, "no json");
  store_.set(directory_.path(), {{"key", 1}});
  EXPECT_EQ(store_.get(directory_.path()), (JsonValue{{"key", 1}}));
  EXPECT_TRUE(log_.messages().empty());
}

TEST_F(AttributeStoreTest, EachGetReadsTheFileAfresh) {
  store_.set(directory_.path(), 1);
  directory_.write(kFileName, "2");
  EXPECT_EQ(store_.get(directory_.path()), 2);
}

TEST_F(AttributeStoreTest, AFileThatCannotBeReadIsReadAsNoAttributesAndLogged) {
  store_.set(directory_.path(), {{"key", 1}});
  files_->failNext(Operation::ReadFile, EIO);
  EXPECT_EQ(store_.get(directory_.path()), JsonValue::object());
  EXPECT_EQ(log_.messages(), std::vector<string>{"Could not get attributes: " + ioFailure(EIO, "Input/output error")});
  EXPECT_EQ(log_.errorCount(), 1U);
}

TEST_F(AttributeStoreTest, ADirectoryInThePlaceOfTheFileIsAFailureOfAccess) {
  directory_.makeDirectory(kFileName);
  EXPECT_EQ(store_.get(directory_.path()), JsonValue::object());
  ASSERT_EQ(log_.errorCount(), 1U);
  EXPECT_TRUE(log_.contains("Could not get attributes: domain: QZLarderIoErrorErrorDomain; "));
  store_.set(directory_.path(), {{"key", 1}});
  EXPECT_EQ(log_.messages().back(),
            "Could not set attributes: " + ioFailure(EISDIR, "Could not open file: Is a directory"));
}

TEST_F(AttributeStoreTest, AFifoInThePlaceOfTheFileIsAFailureOfAccessAndHoldsNobodyUp) {
  const test::Watchdog watchdog(60);
  ASSERT_EQ(mkfifo(directory_.file(kFileName).c_str(), 0600), 0);
  EXPECT_EQ(store_.get(directory_.path()), JsonValue::object());
  EXPECT_EQ(log_.messages().back(),
            "Could not get attributes: " + ioFailure(ESPIPE, "Could not seek to end of file: Illegal seek"));
  store_.set(directory_.path(), {{"key", 1}});
  EXPECT_EQ(log_.messages().back(),
            "Could not set attributes: " + ioFailure(ENXIO, "Could not open file: No such device or address"));
  EXPECT_EQ(log_.errorCount(), 2U);
  store_.remove(directory_.path());
  store_.set(directory_.path(), {{"key", 1}});
  EXPECT_EQ(store_.get(directory_.path()), (JsonValue{{"key", 1}}));
}

TEST_F(AttributeStoreTest, AFailedWriteIsLoggedAndTheNextSetSucceeds) {
  files_->failNext(Operation::WriteFile, ENOSPC);
  store_.set(directory_.path(), {{"key", 1}});
  EXPECT_EQ(log_.messages(),
            std::vector<string>{"Could not set attributes: " + ioFailure(ENOSPC, "No space left on device")});
  EXPECT_EQ(store_.get(directory_.path()), JsonValue::object());
  store_.set(directory_.path(), {{"key", 2}});
  EXPECT_EQ(store_.get(directory_.path()), (JsonValue{{"key", 2}}));
}

TEST_F(AttributeStoreTest, AWriteThatStopsMidwayIsReadAsNoAttributes) {
  files_->tearNextWrite(5, ENOSPC);
  store_.set(directory_.path(), {{"key", "value"}});
  EXPECT_TRUE(log_.contains("Could not set attributes: "));
  EXPECT_EQ(directory_.read(kFileName).size(), 5U);
  EXPECT_EQ(store_.get(directory_.path()), JsonValue::object());
  EXPECT_TRUE(log_.contains("Read invalid json from disk: "));
}

TEST_F(AttributeStoreTest, AValueThatCannotBeSerialisedIsLoggedAndLeavesTheOldDocument) {
  store_.set(directory_.path(), {{"key", 1}});
  store_.set(directory_.path(), {{"key", "\xff"}});
  ASSERT_EQ(log_.errorCount(), 1U);
  EXPECT_EQ(log_.messages().front().find("Could not set attributes: "), 0U);
  EXPECT_EQ(store_.get(directory_.path()), (JsonValue{{"key", 1}}));
}

TEST_F(AttributeStoreTest, RemovingDeletesTheFileAlone) {
  directory_.write("other", "stays");
  store_.set(directory_.path(), {{"key", 1}});
  store_.remove(directory_.path());
  EXPECT_EQ(directory_.names(), std::vector<string>{"other"});
  EXPECT_EQ(store_.get(directory_.path()), JsonValue::object());
}

TEST_F(AttributeStoreTest, RemovingWhereThereIsNothingDoesNothing) {
  store_.remove(directory_.path());
  store_.remove(directory_.file("missing"));
  EXPECT_TRUE(log_.messages().empty());
  EXPECT_EQ(files_->calls(Operation::DeleteFile), 0U);
}

TEST_F(AttributeStoreTest, AFailedRemovalIsLoggedAndTheFileRemains) {
  store_.set(directory_.path(), {{"key", 1}});
  files_->failNext(Operation::DeleteFile, EACCES);
  store_.remove(directory_.path());
  EXPECT_EQ(log_.messages(),
            std::vector<string>{"Could not remove attributes: " + ioFailure(EACCES, "Permission denied")});
  EXPECT_EQ(store_.get(directory_.path()), (JsonValue{{"key", 1}}));
}

TEST_F(AttributeStoreTest, EveryLineIsAnErrorLine) {
  files_->failAlways(Operation::WriteFile, EIO);
  store_.set(directory_.path(), 1);
  directory_.write(kFileName, "x");
  store_.get(directory_.path());
  files_->failAlways(Operation::DeleteFile, EIO);
  store_.remove(directory_.path());
  EXPECT_EQ(log_.lines().size(), 3U);
  EXPECT_EQ(log_.errorCount(), 3U);
}

TEST_F(AttributeStoreTest, FailuresOfAnotherTypeDoNotEscapeEither) {
  store_.set(directory_.path(), 1);
  files_->onCall = [](Operation, const string&) { throw std::logic_error("odd host"); };
  store_.set(directory_.path(), 2);
  EXPECT_EQ(store_.get(directory_.path()), JsonValue::object());
  store_.remove(directory_.path());
  EXPECT_EQ(log_.messages(),
            (std::vector<string>{"Could not set attributes: odd host", "Read invalid json from disk: odd host",
                                 "Could not remove attributes: odd host"}));
}

TEST_F(AttributeStoreTest, ADirectoryWithASlashAtTheEndIsTheSameDirectory) {
  store_.set(directory_.path() + "/", 5);
  EXPECT_EQ(store_.get(directory_.path()), 5);
}

TEST_F(AttributeStoreTest, ADanglingLinkInThePlaceOfTheFileCountsAsNoAttributes) {
  std::filesystem::create_symlink(directory_.file("nowhere"), directory_.file(kFileName));
  EXPECT_EQ(store_.get(directory_.path()), JsonValue::object());
  store_.remove(directory_.path());
  EXPECT_TRUE(log_.messages().empty());
}

TEST_F(AttributeStoreTest, ANotANumberValueNeverMakesTheDocumentUnreadable) {
  store_.set(directory_.path(), {{"ratio", std::numeric_limits<double>::quiet_NaN()}});
  EXPECT_TRUE(store_.get(directory_.path()).is_object());
  EXPECT_TRUE(log_.messages().empty());
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
