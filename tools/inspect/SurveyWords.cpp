#include "inspect/SurveyWords.h"

#include <cmath>

#include "Format.h"
#include "Printable.h"
#include "inspect/Totals.h"
#include "storage/ReadableNames.h"

namespace velmora::mobile::xplat::cellar::tools {

std::string titleOf(const ManagerSurvey& manager) {
  const bool isBelow = manager.path.front() != '.';
  const std::string& place = isBelow ? manager.path : manager.directory;
  std::string title = printable(place + sessionNote(place));
  if (!manager.name.empty()) title += "  " + printable(manager.name);
  if (manager.limitBytes) {
    title += ", " + formatSize(manager.countedBytes) + " of " + formatSize(*manager.limitBytes) + " (" +
             percentText(fillOf(manager)) + ")";
    if (manager.unmanagedBytes > 0) {
      title += ", of which " + formatSize(manager.unmanagedBytes) + " measured now in unmanaged stores";
    }
  }
  return title;
}

std::string limitText(const StoreSurvey& store) {
  if (store.limitBytes) return formatSize(*store.limitBytes);
  return store.capacity ? formatCount(*store.capacity, "item", "items") : "-";
}

std::string percentText(const std::optional<double>& ratio) {
  return ratio ? std::to_string(std::lround(*ratio * 100)) + " %" : "-";
}

}  // namespace velmora::mobile::xplat::cellar::tools
