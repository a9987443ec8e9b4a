#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "manifest/AccessDates.h"
#include "manifest/ManifestRecords.h"

namespace velmora::mobile::xplat::cellar {

// What keys had in memory before changes that are made together, to go back to if those do not come about.
class ManifestUndo {
 public:
  // To be called before each change.
  void note(const std::string& key, const ManifestRecords& records, const AccessDates::Dates& waiting);

  void takeBack(ManifestRecords& records, AccessDates::Dates& waiting) const;

 private:
  struct Former {
    std::string key;
    std::optional<ManifestRecords::Copy> record;
    std::optional<std::int32_t> accessDate;
  };

  std::vector<Former> formers_;
};

}  // namespace velmora::mobile::xplat::cellar
