#pragma once

#include <functional>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "support/Values.h"

namespace velmora::mobile::xplat::cellar::bench {

// What applications use instead: values by key, on the caller's thread. Each is set up as its users would for data that
// survives a killed process, without a sync for each write; those that say "synced" for data that survives a power cut.
class Competitor {
 public:
  Competitor() = default;
  virtual ~Competitor() = default;
  Competitor(const Competitor&) = delete;
  Competitor& operator=(const Competitor&) = delete;

  virtual void put(const std::string& key, const Bytes& value) = 0;
  virtual Bytes get(const std::string& key) = 0;  // throws when there is none
};

using Entries = std::vector<std::pair<std::string, Bytes>>;

// One that can also write several values at once, all of them or none.
class GroupingCompetitor : public Competitor {
 public:
  virtual void putTogether(const Entries& entries) = 0;
};

using OpenCompetitor = std::function<std::unique_ptr<Competitor>(const std::string& directory)>;

using OpenGroupingCompetitor = std::function<std::unique_ptr<GroupingCompetitor>(const std::string& directory)>;

std::unique_ptr<Competitor> openLevelDB(const std::string& directory);
std::unique_ptr<Competitor> openLMDB(const std::string& directory);
std::unique_ptr<Competitor> openRocksDB(const std::string& directory);
std::unique_ptr<Competitor> openSQLite(const std::string& directory);
std::unique_ptr<GroupingCompetitor> openSyncedLevelDB(const std::string& directory);
std::unique_ptr<GroupingCompetitor> openSyncedSQLite(const std::string& directory);

// All of them, by the names that reports have.
const std::vector<std::pair<std::string, OpenCompetitor>>& competitors();

// Those that sync each write, or each group of writes, before they return.
const std::vector<std::pair<std::string, OpenGroupingCompetitor>>& syncedCompetitors();

// What reports call a competitor that writes in groups.
inline std::string inGroups(const std::string& name) { return name + " in groups"; }

}  // namespace velmora::mobile::xplat::cellar::bench
