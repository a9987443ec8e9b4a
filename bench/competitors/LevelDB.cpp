#include <leveldb/db.h>
#include <leveldb/write_batch.h>

#include <stdexcept>

#include "competitors/Competitor.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

void throwUnlessOk(const leveldb::Status& status) {
  if (!status.ok()) throw std::runtime_error(status.ToString());
}

leveldb::Slice sliceOf(const Bytes& value) { return {reinterpret_cast<const char*>(value.data()), value.size()}; }

class LevelDB : public GroupingCompetitor {
 public:
  LevelDB(const std::string& directory, bool isSynced) {
    writeOptions_.sync = isSynced;
    leveldb::Options options;
    options.create_if_missing = true;
    leveldb::DB* database = nullptr;
    throwUnlessOk(leveldb::DB::Open(options, directory + "/leveldb", &database));
    database_.reset(database);
  }

  void put(const std::string& key, const Bytes& value) override {
    throwUnlessOk(database_->Put(writeOptions_, key, sliceOf(value)));
  }

  void putTogether(const Entries& entries) override {
    leveldb::WriteBatch batch;
    for (const auto& [key, value] : entries) batch.Put(key, sliceOf(value));
    throwUnlessOk(database_->Write(writeOptions_, &batch));
  }

  Bytes get(const std::string& key) override {
    std::string value;
    throwUnlessOk(database_->Get(leveldb::ReadOptions(), key, &value));
    return {value.begin(), value.end()};
  }

 private:
  leveldb::WriteOptions writeOptions_;
  std::unique_ptr<leveldb::DB> database_;
};

}  // namespace

std::unique_ptr<Competitor> openLevelDB(const std::string& directory) {
  return std::make_unique<LevelDB>(directory, false);
}

std::unique_ptr<GroupingCompetitor> openSyncedLevelDB(const std::string& directory) {
  return std::make_unique<LevelDB>(directory, true);
}

}  // namespace velmora::mobile::xplat::cellar::bench
