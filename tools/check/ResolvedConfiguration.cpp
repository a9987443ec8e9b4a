#include "check/ResolvedConfiguration.h"

#include "Configuration.h"
#include "StoreDirectoryNameBuilder.h"
#include "host/FileNames.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

ResolvedManager resolveManager(const Configuration& configuration, const std::string& name, const OrderedJson& manager,
                               const StoreDirectoryNameBuilderFactory& names, const std::string& sessionTag) {
  ResolvedManager resolved;
  resolved.pointer = memberPointer("", name);
  resolved.definition = configuration.getManager(name);
  const auto builder = resolved.definition->sessionScoped ? names.createStoreDirectoryNameBuilder(sessionTag)
                                                          : names.createStoreDirectoryNameBuilder();
  resolved.directory = areaName(*resolved.definition) + "/" + builder->buildStoreManagerName();
  const auto stores = manager.find("stores");
  if (stores == manager.end() || !stores->is_object()) return resolved;
  for (const auto& [identifier, store] : stores->items()) {
    const auto definition = configuration.getStore(identifier);
    resolved.stores.push_back({identifier, memberPointer(memberPointer(resolved.pointer, "stores"), identifier),
                               definition, builder->buildStoreName(*definition)});
  }
  return resolved;
}

}  // namespace

ResolvedConfiguration resolve(const ConfigurationDocument& document, const NameTags& tags) {
  const Configuration configuration(document.text);
  const StoreDirectoryNameBuilderFactory names(tags.versionTag, tags.localeSecondTag, tags.localeFirstTag);
  // As the host kit does it.
  const std::string sessionTag = tags.sessionKey.empty() ? "" : host::encodeFileName(tags.sessionKey);
  ResolvedConfiguration resolved;
  for (const auto& [name, manager] : document.root.items()) {
    resolved.push_back(resolveManager(configuration, name, manager, names, sessionTag));
  }
  return resolved;
}

std::string areaName(const StoreManagerDefinition& manager) {
  switch (manager.area) {
    case Area::Documents:
      return "documents";
    case Area::Shared:
      return "shared";
    case Area::Caches:
      break;
  }
  return "caches";
}

std::string typeName(const StoreDefinition& store) {
  switch (store.type) {
    case StoreDefinition::Type::PKVS:
      return "pkvs";
    case StoreDefinition::Type::DiskCache:
      return "disk_cache";
    case StoreDefinition::Type::Unmanaged:
      break;
  }
  return "unmanaged";
}

}  // namespace velmora::mobile::xplat::cellar::tools
