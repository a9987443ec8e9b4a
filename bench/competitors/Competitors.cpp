#include "rivals/Rival.h"

namespace velmora::mobile::xplat::cellar::bench {

const std::vector<std::pair<std::string, OpenRival>>& rivals() {
  static const std::vector<std::pair<std::string, OpenRival>> all = {
      {"LevelDB", openLevelDB}, {"LMDB", openLMDB}, {"RocksDB", openRocksDB}, {"SQLite", openSQLite}};
  return all;
}

}  // namespace velmora::mobile::xplat::cellar::bench
