// Changes that share a transaction, on a database whose writes fail.

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstddef>
#include <functional>
#include <string>
#include <vector>

#include "support/FaultyVfs.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::bytesOf;
using test::Contents;
using test::FaultyVfs;
using test::KeyValueStoreFixture;
using test::told;
using test::VfsCall;
using test::watch;
using test::Written;
using testing::ElementsAre;
using testing::SizeIs;

class GroupCommitFaults : public KeyValueStoreFixture {
 protected:
  Written write(const std::string& key, const std::string& value = "value") {
    return watch(store->store(key, bytesOf(value)));
  }
};

TEST_F(GroupCommitFaults, WritesTheDatabaseOnceForAllOfThem) {
  FaultyVfs vfs;
  open();
  for (int i = 0; i < 20; ++i) put("old" + std::to_string(i), "value");
  const auto writesOf = [&](const std::function<void()>& act) {
    const std::size_t before = vfs.calls(VfsCall::Write);
    act();
    work().runNext();
    return vfs.calls(VfsCall::Write) - before;
  };
  const std::size_t alone = writesOf([&] { write("alone"); });
  settle();
  const std::size_t together = writesOf([&] {
    for (int i = 0; i < 20; ++i) write("key" + std::to_string(i));
  });
  settle();
  EXPECT_LT(together, 4 * alone);
  EXPECT_THAT(store->getAllKeys(), SizeIs(41));
  close();
}

// Each write to the database fails once, at whichever statement of the group it comes.
TEST_F(GroupCommitFaults, AFailingWriteAnywhereInItLosesNothing) {
  for (std::size_t nth = 1;; ++nth) {
    FaultyVfs vfs;
    open();
    put("old", "value");
    put("removed", "value");
    const std::vector<Written> changes = {write("one"), write("old", "newer"), watch(store->removeItem("removed")),
                                          write("two")};
    vfs.failNth(VfsCall::Write, nth, 13);  // SQLITE_FULL
    work().runNext();
    const bool hasFailed = vfs.failures() > 0;
    vfs.heal();
    settle();
    for (const Written& change : changes) EXPECT_EQ(told(change), "<done>") << nth;
    EXPECT_TRUE(trash->collected().empty()) << nth;
    close();
    open();
    EXPECT_EQ(contents(), (Contents{{"old", "newer"}, {"one", "value"}, {"two", "value"}})) << nth;
    EXPECT_THAT(valueFiles(), ElementsAre("old", "one", "two"));
    clear();
    close();
    if (!hasFailed) {
      EXPECT_GT(nth, 1U);
      return;
    }
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
