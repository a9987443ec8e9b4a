#include "Version.h"

#include <sqlite3.h>
#include <zlib.h>

#include <CLI/Version.hpp>
#include <climits>
#include <nlohmann/json.hpp>

namespace velmora::mobile::xplat::cellar::tools {

namespace {

// "SQLite 3.40.1", and if the system has another one by now, that it was built with another one.
std::string loaded(const std::string& name, const std::string& builtWith, const std::string& present) {
  return name + " " + present + (present == builtWith ? "" : " (built with " + builtWith + ")");
}

std::string jsonVersion() {
  return std::to_string(NLOHMANN_JSON_VERSION_MAJOR) + "." + std::to_string(NLOHMANN_JSON_VERSION_MINOR) + "." +
         std::to_string(NLOHMANN_JSON_VERSION_PATCH);
}

std::string buildText() {
  return std::string("built by " CELLAR_COMPILER " as " CELLAR_BUILD_TYPE ", C++") +
         std::to_string(__cplusplus / 100 % 100) + ", " + std::to_string(sizeof(void*) * CHAR_BIT) +
         " bits" CELLAR_SANITIZED;
}

}  // namespace

std::string versionText() {
  return "cellar " CELLAR_VERSION "\n" + buildText() + "\nwith " +
         loaded("SQLite", SQLITE_VERSION, sqlite3_libversion()) + ", " + loaded("zlib", ZLIB_VERSION, zlibVersion()) +
         ", nlohmann-json " + jsonVersion() +
         ", CLI11 " CLI11_VERSION ", glog " CELLAR_GLOG ", Chart.js " CELLAR_CHARTS;
}

}  // namespace velmora::mobile::xplat::cellar::tools
