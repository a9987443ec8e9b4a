#include "demo/DemoReport.h"

#include <string>

#include "Configuration.h"
#include "Console.h"
#include "Format.h"
#include "Table.h"
#include "demo/DemoContext.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

std::string kindOf(const StoreDefinition& store) {
  switch (store.type) {
    case StoreDefinition::Type::Unmanaged:
      return store.isCache ? "unmanaged cache" : "unmanaged";
    case StoreDefinition::Type::PKVS:
      return "key-value";
    case StoreDefinition::Type::DiskCache:
      return "disk cache";
  }
  return "";
}

std::string limitOf(const StoreDefinition& store) {
  if (store.maxSize > 0) return formatSize(store.maxSize);
  const auto* const keyValue = dynamic_cast<const PKVSDefinition*>(&store);
  if (keyValue == nullptr || !keyValue->capacity) return "none";
  return formatCount(static_cast<std::uint64_t>(*keyValue->capacity), "value", "values");
}

}  // namespace

void printStores(DemoContext& context) {
  using Align = Table::Align;
  Table table({{"manager", Align::Left},
               {"kind", Align::Left},
               {"directory", Align::Left},
               {"files", Align::Right},
               {"size", Align::Right},
               {"limit", Align::Right},
               {"left", Align::Right}});
  for (const auto& store : context.stores()) {
    const TreeSize most = context.fullest[store->name];
    const TreeSize left = sizeOfTree(context.app().expectedDirectory(*store));
    table.addRow({store->managerName, kindOf(*store), context.shortDirectory(*store), formatCount(most.files),
                  formatSize(most.bytes), limitOf(*store), left.files == 0 ? "-" : formatSize(left.bytes)});
  }
  context.console.heading("The stores, at their fullest and what is left of them");
  context.console.raw(table.text());
}

void printValues(DemoContext& context) {
  using Align = Table::Align;
  Table table({{"store", Align::Left},
               {"items", Align::Right},
               {"stored", Align::Right},
               {"hits", Align::Right},
               {"misses", Align::Right},
               {"store p50", Align::Right},
               {"store p99", Align::Right},
               {"fetch p50", Align::Right},
               {"fetch p99", Align::Right}});
  for (const auto& [store, items] : context.mostItems) {
    const KeyValueClient& client = context.clientOf(store);
    table.addRow({store, formatCount(items), formatCount(client.storeTimes().count()), formatCount(client.hits()),
                  formatCount(client.misses()), formatTime(client.storeTimes().percentile(50)),
                  formatTime(client.storeTimes().percentile(99)), formatTime(client.fetchTimes().percentile(50)),
                  formatTime(client.fetchTimes().percentile(99))});
  }
  context.console.heading("The stores with keys, as their host saw them");
  context.console.raw(table.text());
  context.console.line("items: at their fullest; times: from the call to the completion of its future, with up to " +
                       formatCount(OperationWindow::kMost) + " under way");
}

void printEvents(DemoContext& context) {
  Table table({{"event", Table::Align::Left}, {"count", Table::Align::Right}});
  for (const auto& [name, count] : context.events.countsByName()) table.addRow({name, formatCount(count)});
  context.console.heading("What was reported to analytics");
  context.console.raw(table.text());
}

}  // namespace velmora::mobile::xplat::cellar::tools
