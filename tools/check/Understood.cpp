#include "check/Understood.h"

#include "Configuration.h"
#include "StoreDirectoryNameBuilder.h"
#include "host/FileNames.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

UnderstoodManager understandManager(const Configuration& configuration, const std::string& name,
                                    const OrderedJson& manager, const StoreDirectoryNameBuilderFactory& names,
                                    const std::string& sessionTag) {
  UnderstoodManager understood;
  understood.pointer = memberPointer("", name);
  understood.definition = configuration.getManager(name);
  const auto builder = understood.definition->sessionScoped ? names.createStoreDirectoryNameBuilder(sessionTag)
                                                            : names.createStoreDirectoryNameBuilder();
  understood.directory = areaName(*understood.definition) + "/" + builder->buildStoreManagerName();
  const auto stores = manager.find("stores");
  if (stores == manager.end() || !stores->is_object()) return understood;
  for (const auto& [identifier, store] : stores->items()) {
    const auto definition = configuration.getStore(identifier);
    understood.stores.push_back({identifier, memberPointer(memberPointer(understood.pointer, "stores"), identifier),
                                 definition, builder->buildStoreName(*definition)});
  }
  return understood;
}

}  // namespace

Understood understand(const ConfigurationDocument& document, const NameTags& tags) {
  const Configuration configuration(document.text);
  const StoreDirectoryNameBuilderFactory names(tags.versionTag, tags.localeSecondTag, tags.localeFirstTag);
  const std::string sessionTag = host::encodeFileName(tags.sessionKey);
  Understood understood;
  for (const auto& [name, manager] : document.root.items()) {
    understood.push_back(understandManager(configuration, name, manager, names, sessionTag));
  }
  return understood;
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
