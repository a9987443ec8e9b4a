#pragma once

#include <memory>
#include <string>
#include <vector>

#include "Export.h"

namespace velmora::mobile::xplat::cellar {

class StoreDefinition;
struct StoreManagerDefinition;

// Names the directories of one manager and its stores, after who owns the data and which version and locale it was
// written for: what bears another name is stale and can be cleaned up. A host may derive from it to name them
// differently; the names must be valid in a path. Immutable: any thread.
//
//   _store_42/            a manager of the session whose tag is "42"; "_sessionlessStore" for one without sessions
//     thumbs_250_v1/      a store without a version of its own: the host's version tag and the definition's version
//     thumbs_v3/          a store with a version of its own: changing the version tag does not retire it
//     thumbs_en_US_v3/    a locale-sensitive one
class CELLAR_EXPORT StoreDirectoryNameBuilder {
 public:
  // For managers whose data belongs to no session.
  StoreDirectoryNameBuilder(const std::string& versionTag, const std::string& localeSecondTag,
                            const std::string& localeFirstTag);

  // For the managers of one session. An empty tag is a tag too.
  StoreDirectoryNameBuilder(const std::string& versionTag, const std::string& localeSecondTag,
                            const std::string& localeFirstTag, const std::string& sessionTag);

  virtual ~StoreDirectoryNameBuilder();

  // The manager's directory name in its area.
  virtual std::string buildStoreManagerName() const;

  // Whether directories of other sessions may lie next to the manager's own.
  virtual bool hasStaleNamesInParent(const StoreManagerDefinition& manager) const;

  // Those of `names` that are managers' directories of sessions, in their order; the current session's own is among
  // them.
  virtual std::vector<std::string> filterStoreManagerNames(const StoreManagerDefinition& manager,
                                                           const std::vector<std::string>& names) const;

  // The store's directory name in its manager's directory.
  virtual std::string buildStoreName(const StoreDefinition& store) const;

 private:
  const bool hasSession_;
  const std::string versionTag_;
  const std::string localeSecondTag_;
  const std::string localeFirstTag_;
  const std::string sessionTag_;
};

// Makes the name builders of an application. Its strings are the host's: a version tag that changes when data written
// by earlier releases is to be retired, and the two parts of the locale. Immutable: any thread.
class CELLAR_EXPORT StoreDirectoryNameBuilderFactory {
 public:
  StoreDirectoryNameBuilderFactory(const std::string& versionTag, const std::string& localeSecondTag,
                                   const std::string& localeFirstTag);

  // For the managers of the session with that tag.
  std::shared_ptr<StoreDirectoryNameBuilder> createStoreDirectoryNameBuilder(const std::string& sessionTag) const;

  // For managers whose data belongs to no session.
  std::shared_ptr<StoreDirectoryNameBuilder> createStoreDirectoryNameBuilder() const;

 private:
  const std::string versionTag_;
  const std::string localeSecondTag_;
  const std::string localeFirstTag_;
};

}  // namespace velmora::mobile::xplat::cellar
