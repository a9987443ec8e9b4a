#include <leveldb/db.h>

#include <stdexcept>

#include "competitors/Competitor.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

void throwUnlessOk(const leveldb::Status& status) {
  if (!status.ok()) throw std::runtime_error(status.ToString());
}

class LevelDB : public Competitor {
 public:
  explicit LevelDB(const std::string& directory) {
    leveldb::Options options;
    options.create_if_missing = true;
    leveldb::DB* database = nullptr;
    throwUnlessOk(leveldb::DB::Open(options, directory + "/leveldb", &database));
    database_.reset(database);
  }

  void put(const std::string& key, const Bytes& value) override {
    const leveldb::Slice bytes(reinterpret_cast<const char*>(value.data()), value.size());
    throwUnlessOk(database_->Put(leveldb::WriteOptions(), key, bytes));
  }

  Bytes get(const std::string& key) override {
    std::string value;
    throwUnlessOk(database_->Get(leveldb::ReadOptions(), key, &value));
    return {value.begin(), value.end()};
  }

 private:
  std::unique_ptr<leveldb::DB> database_;
};

}  // namespace

std::unique_ptr<Competitor> openLevelDB(const std::string& directory) { return std::make_unique<LevelDB>(directory); }

}  // namespace velmora::mobile::xplat::cellar::bench
