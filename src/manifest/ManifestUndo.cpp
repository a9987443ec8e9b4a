#include "manifest/ManifestUndo.h"

#include <utility>

namespace velmora::mobile::xplat::cellar {

void ManifestUndo::note(const std::string& key, const ManifestRecords& records, const AccessDates::Dates& waiting) {
  Former former{key, std::nullopt, std::nullopt};
  if (const ManifestRecord* const record = records.find(key)) former.record = records.copyOf(*record);
  const auto date = waiting.find(key);
  if (date != waiting.end()) former.accessDate = date->second;
  formers_.push_back(std::move(former));
}

// The latest change first.
void ManifestUndo::takeBack(ManifestRecords& records, AccessDates::Dates& waiting) const {
  for (auto former = formers_.rbegin(); former != formers_.rend(); ++former) {
    if (former->record) {
      records.restore(*former->record);
    } else if (const ManifestRecord* const record = records.find(former->key)) {
      records.remove(*record);
    }
    if (former->accessDate) waiting[former->key] = *former->accessDate;
  }
}

}  // namespace velmora::mobile::xplat::cellar
