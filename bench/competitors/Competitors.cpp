#include "competitors/Competitor.h"

namespace velmora::mobile::xplat::cellar::bench {

const std::vector<std::pair<std::string, OpenCompetitor>>& competitors() {
  static const std::vector<std::pair<std::string, OpenCompetitor>> all = {
      {"LevelDB", openLevelDB}, {"LMDB", openLMDB}, {"RocksDB", openRocksDB}, {"SQLite", openSQLite}};
  return all;
}

const std::vector<std::pair<std::string, OpenGroupingCompetitor>>& syncedCompetitors() {
  static const std::vector<std::pair<std::string, OpenGroupingCompetitor>> all = {{"LevelDB", openSyncedLevelDB},
                                                                                  {"SQLite", openSyncedSQLite}};
  return all;
}

}  // namespace velmora::mobile::xplat::cellar::bench
