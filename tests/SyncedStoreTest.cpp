// What reaches the medium, and when: the system calls of synced stores, told by this program's own versions of them.

#include <dlfcn.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <future>
#include <string>
#include <vector>

#include "Durability.h"
#include "support/KeyValueStoreFixture.h"

namespace velmora::mobile::xplat::cellar {
namespace {

// "write NAME" (several in a row are one), "sync NAME", and "sync NAME, N bytes" of a regular file other than the
// manifest's own, whose bytes are not ours to say.
class CallTrace {
 public:
  static void wrote(int descriptor) {
    if (calls_ == nullptr) return;
    const std::string call = "write " + nameOf(descriptor);
    if (calls_->empty() || calls_->back() != call) calls_->push_back(call);
  }

  static void synced(int descriptor) {
    if (calls_ == nullptr) return;
    struct ::stat status {};
    const std::string name = nameOf(descriptor);
    const bool isValue = ::fstat(descriptor, &status) == 0 && S_ISREG(status.st_mode) && name.find("manifest") != 0;
    calls_->push_back("sync " + name + (isValue ? ", " + std::to_string(status.st_size) + " bytes" : ""));
  }

  static void note(const std::string& event) { calls_->push_back(event); }

  explicit CallTrace(std::vector<std::string>& calls) { calls_ = &calls; }
  CallTrace(const CallTrace&) = delete;
  CallTrace& operator=(const CallTrace&) = delete;
  ~CallTrace() { calls_ = nullptr; }

 private:
  // Without the number and the checksum of a value's file.
  static std::string nameOf(int descriptor) {
    const auto path = std::filesystem::read_symlink("/proc/self/fd/" + std::to_string(descriptor));
    const std::string name = path.filename().string();
    return name.rfind("manifest", 0) == 0 ? name : name.substr(0, name.find('.'));
  }

  static inline std::vector<std::string>* calls_ = nullptr;
};

}  // namespace
}  // namespace velmora::mobile::xplat::cellar

using velmora::mobile::xplat::cellar::CallTrace;

namespace {

template <class Function> Function* real(Function* /*own*/, const char* name) {
  return reinterpret_cast<Function*>(::dlsym(RTLD_NEXT, name));
}

}  // namespace

// Visible, so that the libraries use these as well.
extern "C" {
#pragma GCC visibility push(default)

int fsync(int descriptor) {
  CallTrace::synced(descriptor);
  return real(&fsync, "fsync")(descriptor);
}

int fdatasync(int descriptor) {
  CallTrace::synced(descriptor);
  return real(&fdatasync, "fdatasync")(descriptor);
}

ssize_t write(int descriptor, const void* bytes, size_t count) {
  CallTrace::wrote(descriptor);
  return real(&write, "write")(descriptor, bytes, count);
}

// How SQLite writes.
ssize_t pwrite64(int descriptor, const void* bytes, size_t count, off64_t offset) {
  CallTrace::wrote(descriptor);
  return real(&pwrite64, "pwrite64")(descriptor, bytes, count, offset);
}

#pragma GCC visibility pop
}  // extern "C"

namespace velmora::mobile::xplat::cellar {
namespace {

using test::bytesOf;
using test::KeyValueStoreFixture;
using testing::ElementsAre;
using testing::IsEmpty;

class SyncedStore : public KeyValueStoreFixture {
 protected:
  using Calls = std::vector<std::string>;

  SyncedStore() { options.durability = Durability::Synced; }

  // Of stores of these keys, all waiting at once, to the time when all are acknowledged. What is deleted afterwards
  // is not looked at.
  Calls callsOfStoring(const std::vector<std::string>& keys) {
    Calls calls;
    const CallTrace trace(calls);
    for (const std::string& key : keys) {
      store->store(key, bytesOf("value")).then(nullptr, [key](std::future<void>& result) {
        result.get();
        CallTrace::note("acknowledge " + key);
      });
    }
    file().runAll();
    settle();
    return calls;
  }
};

TEST_F(SyncedStore, SyncsTheFileTheDirectoryAndTheRecordBeforeItAcknowledges) {
  open();
  EXPECT_THAT(callsOfStoring({"key"}),
              ElementsAre("write key", "sync key, 5 bytes", "sync store", "write manifest_v1.sqlite-wal",
                          "sync manifest_v1.sqlite-wal", "acknowledge key"));
}

TEST_F(SyncedStore, SyncsANewFileInPlaceOfAnOldOne) {
  open();
  put("key", "an older value");
  EXPECT_THAT(callsOfStoring({"key"}),
              ElementsAre("write key", "sync key, 5 bytes", "sync store", "write manifest_v1.sqlite-wal",
                          "sync manifest_v1.sqlite-wal", "acknowledge key"));
}

TEST_F(SyncedStore, SharesTheSyncsOfDirectoryAndRecordsAmongTheWritesThatWait) {
  open();
  EXPECT_THAT(callsOfStoring({"a", "b", "c"}),
              ElementsAre("write a", "write b", "write c", "sync a, 5 bytes", "sync b, 5 bytes", "sync c, 5 bytes",
                          "sync store", "write manifest_v1.sqlite-wal", "sync manifest_v1.sqlite-wal", "acknowledge a",
                          "acknowledge b", "acknowledge c"));
}

TEST_F(SyncedStore, SyncsAnInlineValueWithItsRecord) {
  options.inlineData = true;
  open();
  EXPECT_THAT(callsOfStoring({"a", "b"}), ElementsAre("write manifest_v1.sqlite-wal", "sync manifest_v1.sqlite-wal",
                                                      "acknowledge a", "acknowledge b"));
}

TEST_F(SyncedStore, SyncsARemoval) {
  open();
  put("key", "value");
  Calls calls;
  const CallTrace trace(calls);
  EXPECT_EQ(drop("key"), "<done>");
  EXPECT_THAT(calls, ElementsAre("write manifest_v1.sqlite-wal", "sync manifest_v1.sqlite-wal"));
}

TEST_F(SyncedStore, SyncsAccessDatesTogether) {
  open();
  for (const char* key : {"a", "b", "c"}) put(key, "value");
  clock.advance(10);
  for (const char* key : {"a", "b", "c"}) EXPECT_EQ(get(key), "value");
  Calls calls;
  {
    const CallTrace trace(calls);
    ASSERT_TRUE(fire(120));
  }
  EXPECT_THAT(calls, ElementsAre("write manifest_v1.sqlite-wal", "sync manifest_v1.sqlite-wal"));
  for (const std::string& row : rowsOnDisk()) EXPECT_THAT(row, testing::HasSubstr(std::to_string(kStart + 10)));
}

TEST_F(SyncedStore, IsTheOnlyOneThatSyncs) {
  for (const Durability durability : {Durability::Relaxed, Durability::Safe}) {
    options.durability = durability;
    open();
    Calls syncs = callsOfStoring({"a", "b"});
    syncs.erase(
        std::remove_if(syncs.begin(), syncs.end(), [](const std::string& call) { return call.rfind("sync", 0) != 0; }),
        syncs.end());
    EXPECT_THAT(syncs, IsEmpty());
    close();
  }
}

}  // namespace
}  // namespace velmora::mobile::xplat::cellar
