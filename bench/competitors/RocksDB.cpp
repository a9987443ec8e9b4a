#include <rocksdb/db.h>

#include <stdexcept>

#include "competitors/Competitor.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

void throwUnlessOk(const rocksdb::Status& status) {
  if (!status.ok()) throw std::runtime_error(status.ToString());
}

class RocksDB : public Competitor {
 public:
  explicit RocksDB(const std::string& directory) {
    rocksdb::Options options;
    options.create_if_missing = true;
    rocksdb::DB* database = nullptr;
    throwUnlessOk(rocksdb::DB::Open(options, directory + "/rocksdb", &database));
    database_.reset(database);
  }

  void put(const std::string& key, const Bytes& value) override {
    const rocksdb::Slice bytes(reinterpret_cast<const char*>(value.data()), value.size());
    throwUnlessOk(database_->Put(rocksdb::WriteOptions(), key, bytes));
  }

  Bytes get(const std::string& key) override {
    rocksdb::PinnableSlice value;
    throwUnlessOk(database_->Get(rocksdb::ReadOptions(), database_->DefaultColumnFamily(), key, &value));
    return {value.data(), value.data() + value.size()};
  }

 private:
  std::unique_ptr<rocksdb::DB> database_;
};

}  // namespace

std::unique_ptr<Competitor> openRocksDB(const std::string& directory) { return std::make_unique<RocksDB>(directory); }

}  // namespace velmora::mobile::xplat::cellar::bench
