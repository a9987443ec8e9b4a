#include <lmdb.h>

#include <filesystem>
#include <stdexcept>

#include "competitors/Competitor.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr std::size_t kMapSize = std::size_t{4} << 30U;
constexpr mdb_mode_t kFileMode = 0664;

void throwUnlessOk(int result) {
  if (result != MDB_SUCCESS) throw std::runtime_error(mdb_strerror(result));
}

MDB_val bytesOf(const void* data, std::size_t size) { return {size, const_cast<void*>(data)}; }

// A transaction for each operation. Without a sync: what is written is the system's by then, so a killed process loses
// nothing.
class LMDB : public Competitor {
 public:
  explicit LMDB(const std::string& directory) {
    const std::string path = directory + "/lmdb";
    std::filesystem::create_directory(path);
    throwUnlessOk(mdb_env_create(&environment_));
    throwUnlessOk(mdb_env_set_mapsize(environment_, kMapSize));
    throwUnlessOk(mdb_env_open(environment_, path.c_str(), MDB_NOSYNC, kFileMode));
    MDB_txn* transaction = begin(0);
    throwUnlessOk(mdb_dbi_open(transaction, nullptr, 0, &table_));
    throwUnlessOk(mdb_txn_commit(transaction));
  }
  ~LMDB() override { mdb_env_close(environment_); }
  LMDB(const LMDB&) = delete;
  LMDB& operator=(const LMDB&) = delete;

  void put(const std::string& key, const Bytes& value) override {
    MDB_txn* const transaction = begin(0);
    MDB_val name = bytesOf(key.data(), key.size());
    MDB_val bytes = bytesOf(value.data(), value.size());
    const int result = mdb_put(transaction, table_, &name, &bytes, 0);
    if (result != MDB_SUCCESS) mdb_txn_abort(transaction);
    throwUnlessOk(result);
    throwUnlessOk(mdb_txn_commit(transaction));
  }

  Bytes get(const std::string& key) override {
    MDB_txn* const transaction = begin(MDB_RDONLY);
    MDB_val name = bytesOf(key.data(), key.size());
    MDB_val bytes{};
    const int result = mdb_get(transaction, table_, &name, &bytes);
    const auto* const first = static_cast<const unsigned char*>(bytes.mv_data);
    Bytes value = result == MDB_SUCCESS ? Bytes(first, first + bytes.mv_size) : Bytes();
    mdb_txn_abort(transaction);
    throwUnlessOk(result);
    return value;
  }

 private:
  MDB_txn* begin(unsigned int flags) {
    MDB_txn* transaction = nullptr;
    throwUnlessOk(mdb_txn_begin(environment_, nullptr, flags, &transaction));
    return transaction;
  }

  MDB_env* environment_ = nullptr;
  MDB_dbi table_ = 0;
};

}  // namespace

std::unique_ptr<Competitor> openLMDB(const std::string& directory) { return std::make_unique<LMDB>(directory); }

}  // namespace velmora::mobile::xplat::cellar::bench
