#include "storage/ReadableNames.h"

#include <filesystem>
#include <stdexcept>

#include "host/FileNames.h"
#include "storage/Layout.h"

namespace velmora::mobile::xplat::cellar::tools {

std::string decodedName(const std::string& name) {
  try {
    const std::string decoded = host::decodeFileName(name);
    return decoded == name ? "" : decoded;
  } catch (const std::invalid_argument&) {
    return "";
  }
}

std::string sessionNote(const std::string& path) {
  for (const auto& part : std::filesystem::path(path)) {
    ManagerPlace manager;
    manager.name = part.string();
    const bool isManager = manager.name.rfind("_store_", 0) == 0;
    const std::string decoded = isManager ? decodedName(manager.sessionTag()) : "";
    if (!decoded.empty()) return " (session '" + decoded + "')";
  }
  return "";
}

}  // namespace velmora::mobile::xplat::cellar::tools
