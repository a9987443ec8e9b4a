#include "StoreDirectoryNameBuilder.h"

#include <algorithm>
#include <iterator>

#include "StoreDefinition.h"

namespace velmora::mobile::xplat::cellar {

namespace {

const std::string kSessionPrefix = "_store_";
const std::string kSessionlessName = "_sessionlessStore";

}  // namespace

StoreDirectoryNameBuilder::StoreDirectoryNameBuilder(const std::string& versionTag, const std::string& localeSecondTag,
                                                     const std::string& localeFirstTag)
    : hasSession_(false), versionTag_(versionTag), localeSecondTag_(localeSecondTag), localeFirstTag_(localeFirstTag) {}

StoreDirectoryNameBuilder::StoreDirectoryNameBuilder(const std::string& versionTag, const std::string& localeSecondTag,
                                                     const std::string& localeFirstTag, const std::string& sessionTag)
    : hasSession_(true),
      versionTag_(versionTag),
      localeSecondTag_(localeSecondTag),
      localeFirstTag_(localeFirstTag),
      sessionTag_(sessionTag) {}

StoreDirectoryNameBuilder::~StoreDirectoryNameBuilder() = default;

std::string StoreDirectoryNameBuilder::buildStoreManagerName() const {
  return hasSession_ ? kSessionPrefix + sessionTag_ : kSessionlessName;
}

bool StoreDirectoryNameBuilder::hasStaleNamesInParent(const StoreManagerDefinition& /*manager*/) const {
  return hasSession_;
}

std::vector<std::string> StoreDirectoryNameBuilder::filterStoreManagerNames(
    const StoreManagerDefinition& /*manager*/, const std::vector<std::string>& names) const {
  std::vector<std::string> sessionNames;
  std::copy_if(names.begin(), names.end(), std::back_inserter(sessionNames),
               [](const std::string& name) { return name.compare(0, kSessionPrefix.size(), kSessionPrefix) == 0; });
  return sessionNames;
}

std::string StoreDirectoryNameBuilder::buildStoreName(const StoreDefinition& store) const {
  std::string name = store.name;
  if (store.localeSensitive) name += "_" + localeFirstTag_ + "_" + localeSecondTag_;
  name += store.hasVersion ? "_v" : "_" + versionTag_ + "_v";
  return name + std::to_string(store.version);
}

StoreDirectoryNameBuilderFactory::StoreDirectoryNameBuilderFactory(const std::string& versionTag,
                                                                   const std::string& localeSecondTag,
                                                                   const std::string& localeFirstTag)
    : versionTag_(versionTag), localeSecondTag_(localeSecondTag), localeFirstTag_(localeFirstTag) {}

std::shared_ptr<StoreDirectoryNameBuilder> StoreDirectoryNameBuilderFactory::createStoreDirectoryNameBuilder(
    const std::string& sessionTag) const {
  return std::make_shared<StoreDirectoryNameBuilder>(versionTag_, localeSecondTag_, localeFirstTag_, sessionTag);
}

std::shared_ptr<StoreDirectoryNameBuilder> StoreDirectoryNameBuilderFactory::createStoreDirectoryNameBuilder() const {
  return std::make_shared<StoreDirectoryNameBuilder>(versionTag_, localeSecondTag_, localeFirstTag_);
}

}  // namespace velmora::mobile::xplat::cellar
