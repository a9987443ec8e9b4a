#include "host/configuration/Reading.h"

#include <algorithm>
#include <cstddef>
#include <map>
#include <stdexcept>
#include <utility>

#include <cellar/Configuration.h>
#include <cellar/JsonValue.h>
#include <cellar/LarderException.h>
#include <cellar/host/Errors.h>

#include "host/configuration/Faults.h"
#include "host/configuration/Outline.h"
#include "host/errors/Texts.h"

namespace velmora::mobile::xplat::cellar::host {

namespace {

struct Place {
  std::string pointer;
  std::size_t line;
  std::size_t column;
};

Place placeOf(const ConfigurationFault& fault, const std::string& json) {
  const std::size_t at = std::min(fault.at, json.size());
  const auto lineFeeds = std::count(json.begin(), json.begin() + static_cast<std::ptrdiff_t>(at), '\n');
  const std::size_t lineFeed = at == 0 ? std::string::npos : json.rfind('\n', at - 1);
  const std::size_t lineBegin = lineFeed == std::string::npos ? 0 : lineFeed + 1;
  return {fault.pointer, static_cast<std::size_t>(lineFeeds) + 1, at - lineBegin + 1};
}

// An exception of the library with its place.
template <class Error> class Located : public Error, public ConfigurationError {
 public:
  Located(const Error& original, const Place& place)
      : Error(original), ConfigurationError(original.what(), place.pointer, place.line, place.column) {}

  const char* what() const noexcept override { return text().c_str(); }
};

// The first fault that the library words like this, which is the one that it met: those before it are of the same
// manager or store. Where the library's words do not tell what is wrong they are others, and it is the first of all.
Place placeOfRefusal(const char* text, const std::string& json) {
  const auto faults = faultsOf(json);
  const auto culprit =
      std::find_if(faults.begin(), faults.end(), [&](const auto& fault) { return fault.text == text; });
  return placeOf(culprit != faults.end() ? *culprit : faults.front(), json);
}

template <class Error> [[noreturn]] void throwLocated(const Error& refusal, const std::string& json) {
  throw Located<Error>(refusal, placeOfRefusal(refusal.what(), json));
}

std::shared_ptr<const Configuration> readLocating(const std::string& json) {
  try {
    return std::make_shared<const Configuration>(json);
  } catch (const ConfigurationException& refusal) {
    throwLocated(refusal, json);
  } catch (const std::invalid_argument& refusal) {
    throwLocated(refusal, json);
  } catch (const JsonValue::parse_error& refusal) {
    throwLocated(refusal, json);
  } catch (const JsonValue::type_error& refusal) {
    throwLocated(refusal, json);
  } catch (const JsonValue::out_of_range& refusal) {
    throwLocated(refusal, json);
  }
}

// Managers of one area and scope share a directory, and each treats the stores of the other as stale.
void refuseSharedDirectories(const Configuration& configuration, const std::string& json) {
  std::map<std::pair<Area, bool>, std::string> owners;
  for (const Outline& manager : outlineOf(json).members) {
    const auto definition = configuration.getManager(manager.name);
    const auto [owner, isFree] = owners.emplace(std::pair(definition->area, definition->sessionScoped), manager.name);
    if (isFree) continue;
    try {
      throw ConfigurationException(joined({"Managers '", owner->second, "' and '", manager.name,
                                           "' would share a directory, give them different areas or session scopes."}));
    } catch (const ConfigurationException& refusal) {
      const ConfigurationFault fault{memberPointer("", manager.name), manager.begin, ""};
      throw Located<ConfigurationException>(refusal, placeOf(fault, json));
    }
  }
}

}  // namespace

std::shared_ptr<const Configuration> readConfiguration(const std::string& json) {
  auto configuration = readLocating(json);
  refuseSharedDirectories(*configuration, json);
  return configuration;
}

}  // namespace velmora::mobile::xplat::cellar::host
