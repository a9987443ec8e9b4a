#include <algorithm>
#include <cstdint>
#include <string>
#include <vector>

#include "Console.h"
#include "Format.h"
#include "Progress.h"
#include "Stopwatch.h"
#include "demo/DemoContext.h"
#include "demo/DemoPlacing.h"
#include "demo/DemoSteps.h"
#include "demo/SkewedOrder.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr std::uint64_t kSeed = 20240229;
constexpr std::size_t kUsesForEachUnknownKey = 50;

struct Accesses {
  std::size_t hits = 0;
  std::size_t misses = 0;
};

Accesses accessesSoFar(DemoContext& context) {
  Accesses accesses;
  for (const auto& store : context.managedStores()) {
    const KeyValueClient& client = context.values(store->name);
    accesses.hits += client.hits();
    accesses.misses += client.misses();
  }
  return accesses;
}

// Stores whose future has been fulfilled.
std::size_t storesSoFar(DemoContext& context) {
  std::size_t stores = 0;
  for (const auto& store : context.managedStores()) stores += context.values(store->name).storeTimes().count();
  return stores;
}

void finishAll(DemoContext& context) {
  for (const auto& store : context.managedStores()) context.values(store->name).finish();
}

std::vector<DateRange> usesOf(const KeyValueClient::Items& items) {
  std::vector<DateRange> uses;
  for (const auto& item : items) uses.push_back(item.second.used);
  return uses;
}

// A store with a capacity makes room for each new value by letting go of the one used least recently. Takes out what
// has gone, as far as that is right.
void dropEvicted(DemoContext& context, const std::string& store, std::size_t capacity) {
  KeyValueClient& client = context.values(store);
  const std::size_t stored = client.items().size();
  const std::vector<std::string> keys = client.keysInStore();
  KeyValueClient::Items evicted;
  for (const std::string& key : client.keys()) {
    if (!std::binary_search(keys.begin(), keys.end(), key)) evicted.insert(client.items().extract(key));
  }
  context.checks.equal("values left in " + store, std::min(stored, capacity), client.items().size());
  context.checks.isTrue("what " + store + " let go was used least recently",
                        canBeBefore(usesOf(evicted), usesOf(client.items())));
  if (evicted.empty()) return;
  context.console.line(store + ": of " + formatCount(stored) + " values the " + formatCount(capacity) +
                       " are left that there may be, inside the manifest");
}

// Every access that the host has seen, and no other, has been reported.
void checkAccessReports(DemoContext& context) {
  Accesses reported;
  for (const JsonValue& payload : context.events.payloads("qzpkvs_access")) {
    ++(payload.at("hit") == 0 ? reported.hits : reported.misses);
  }
  const Accesses seen = accessesSoFar(context);
  context.checks.equal("hits reported", seen.hits, reported.hits);
  context.checks.equal("misses reported", seen.misses, reported.misses);
}

// Uses of the most popular hundredth of the things, in percent of all.
std::size_t shareOfMostPopular(std::size_t count, const std::vector<std::size_t>& order) {
  std::vector<std::size_t> uses(count);
  for (const std::size_t thing : order) ++uses[thing];
  std::sort(uses.rbegin(), uses.rend());
  std::size_t popular = 0;
  for (std::size_t i = 0; i < std::max<std::size_t>(1, count / 100); ++i) popular += uses[i];
  return popular * 100 / order.size();
}

void removeDraft(DemoContext& context) {
  KeyValueClient& drafts = context.values("drafts");
  if (drafts.items().empty()) return;
  const std::string key = drafts.keys().front();
  const std::size_t missesBefore = drafts.misses();
  drafts.remove(key);
  drafts.fetch(key);
  context.checkValues();
  context.checks.equal("misses of a removed draft", missesBefore + 1, drafts.misses());
  context.console.line(key + " is removed, and is a miss from then on");
}

}  // namespace

void storeByKey(DemoContext& context) {
  const std::vector<Placement> placements = placeFiles(context.source);
  const Stopwatch watch;
  std::uint64_t bytes = 0;
  {
    Progress progress(context.console, placements.size());
    for (const Placement& placement : placements) {
      KeyValueClient& client = context.values(placement.store);
      client.store(placement.key, placement.value);
      const std::uint64_t size = client.items()[placement.key].size;
      progress.advance(size);
      bytes += size;
    }
    finishAll(context);
  }
  context.console.line(formatFiles({placements.size(), bytes}) + " stored by key in " + formatTime(watch.elapsed()) +
                       ", up to " + formatCount(OperationWindow::kMost) + " at a time in each store");
  context.checks.equal("values stored", placements.size(), storesSoFar(context));
  context.app().settle();
  for (const auto& store : context.managedStores()) {
    const auto* const keyValue = dynamic_cast<const PKVSDefinition*>(store.get());
    if (keyValue != nullptr && keyValue->capacity) {
      dropEvicted(context, store->name, static_cast<std::size_t>(*keyValue->capacity));
    } else {
      context.console.line(store->name + ": " + formatFiles(context.values(store->name).size()));
    }
  }
  context.checkValues();
}

void useByKey(DemoContext& context) {
  const std::vector<Placement> placements = placeFiles(context.source);
  const auto order = skewedOrder(placements.size(), placements.size(), kSeed);
  const Stopwatch watch;
  for (std::size_t i = 0; i < order.size(); ++i) {
    const Placement& placement = placements[order[i]];
    context.values(placement.store).fetch(placement.key);
    if (i % kUsesForEachUnknownKey == 0) context.values(placement.store).fetch("unknown-" + std::to_string(i));
  }
  finishAll(context);
  const Accesses accesses = accessesSoFar(context);
  context.console.line(formatCount(accesses.hits + accesses.misses, "fetch", "fetches") + " in " +
                       formatTime(watch.elapsed()) + ", " + formatCount(shareOfMostPopular(placements.size(), order)) +
                       " % of them for the most popular hundredth: " + formatCount(accesses.hits, "hit", "hits") +
                       ", each compared with its file byte for byte, and " +
                       formatCount(accesses.misses, "miss", "misses"));
  context.checkValues();
  checkAccessReports(context);

  removeDraft(context);
}

void findAgain(DemoContext& context) {
  const std::size_t hitsBefore = accessesSoFar(context).hits;
  context.restartTimed();
  context.checkValues();
  const Stopwatch watch;
  std::size_t items = 0;
  for (const auto& store : context.managedStores()) {
    KeyValueClient& client = context.values(store->name);
    items += client.items().size();
    client.fetchAll();
  }
  context.console.line(formatCount(items, "value", "values") +
                       " that were left, each fetched and compared byte for byte, in " + formatTime(watch.elapsed()));
  context.checks.equal("values found again", items, accessesSoFar(context).hits - hitsBefore);
  context.checkContents();
}

}  // namespace velmora::mobile::xplat::cellar::tools
