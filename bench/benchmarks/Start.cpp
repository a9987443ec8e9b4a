#include <cstddef>
#include <memory>
#include <stdexcept>
#include <string>
#include <vector>

#include <cellar/host/Await.h>
#include <cellar/host/Host.h>

#include "benchmarks/Benchmarks.h"
#include "lower_bounds/ManifestLowerBound.h"
#include "support/Fill.h"
#include "support/Samples.h"
#include "support/Stopwatch.h"
#include "support/StoreUnderTest.h"

namespace velmora::mobile::xplat::cellar::bench {

namespace {

constexpr std::size_t kStores = 200;

// A manager with stores of every kind.
std::string configuration() {
  const std::vector<std::string> kinds = {R"({"type": "disk_cache", "lru_size_limit": "10MB"})", R"({"type": "pkvs"})",
                                          R"({"type": "unmanaged", "is_cache": true, "max_size": "10MB"})",
                                          R"({"type": "pkvs", "inline_data": true, "capacity": 100})"};
  std::string text = R"({"app": {"area": "caches", "max_size": "1GB", "prune_interval": "1 hours", "stores": {)";
  for (std::size_t i = 0; i < kStores; ++i) {
    text += (i == 0 ? "\"store" : ", \"store") + std::to_string(i) + "\": " + kinds[i % kinds.size()];
  }
  return text + "}}}";
}

struct StartTimes {
  double host;    // parsing the configuration, starting threads
  double store;   // from there until the first store was there
  double result;  // and until its first fetch returned
};

StartTimes start(const std::string& root) {
  const std::string text = configuration();
  const Stopwatch watch;
  host::Host host(text, root);
  const double built = watch.microseconds();
  const auto store = host.store<DiskCache>("store0");
  const double had = watch.microseconds();
  if (host::await(store->fetch("absent")) != nullptr) throw std::runtime_error("an absent key was found");
  return {built, had - built, watch.microseconds() - built};
}

void measureHost(const Context& context, const Place& place) {
  std::vector<double> host;
  std::vector<double> first;
  std::vector<double> store;
  std::vector<double> result;
  for (int i = 0; i < context.scaled(41, 11); ++i) {
    const Scratch scratch(place);
    first.push_back(start(scratch.path()).store);
    const StartTimes again = start(scratch.path());
    host.push_back(again.host);
    store.push_back(again.store);
    result.push_back(again.result);
  }
  const auto add = [&](const std::string& what, const std::vector<double>& samples, const std::vector<Goal>& goals) {
    context.report.add(Row{what, place.name, cpuName(false), "us", {{"ours", median(samples)}}, goals});
  };
  add("configuration of 200 stores and threads", host, {});
  add("from the factory to the first store ever", first, {{"", 2000}});
  add("from the factory to the first store, again", store, {{"", 2000}});
  add("from the factory to its first result", result, {{"", 2000}});
}

double fetchOne(StoreUnderTest& store, std::size_t number) {
  const Stopwatch watch;
  const auto found = host::await(store->fetch(keyOf(number)));
  const double taken = watch.microseconds();
  if (found == nullptr) throw std::runtime_error("item " + std::to_string(number) + " is missing");
  throwUnlessStamped(found->value.data(), found->value.size(), Manifests::kItemSize, number);
  return taken;
}

double selectOne(ManifestLowerBound& manifest, std::size_t number) {
  const std::string key = keyOf(number);
  const Stopwatch watch;
  Statement statement(manifest.database(),
                      "SELECT  key,  filename,  size,  has_inline_data,  modification_date,  last_access_date,  "
                      "extended_manifest FROM LarderManifest WHERE key = ?1;");
  if (!statement.text(1, key).next()) throw std::runtime_error("no record of " + key);
  return watch.microseconds();
}

// A fetch from a cache whose manifest is not in memory, against one from a loaded cache and the SELECT of its record.
void measureUnloaded(const Context& context, const Place& place) {
  const std::size_t items = context.scaled<std::size_t>(1'000'000, 100'000);
  constexpr std::size_t fetched = 50;
  const Scratch scratch(place);
  const std::string directory = scratch / "store";
  context.manifests.copyTo(directory, items);
  fillFiles(directory, fetched);

  std::vector<double> loaded;
  std::vector<double> selected;
  {
    StoreUnderTest store(directory);
    for (std::size_t number = 0; number < fetched; ++number) loaded.push_back(fetchOne(store, number));
  }
  {
    ManifestLowerBound manifest(directory);
    for (std::size_t number = 0; number < fetched; ++number) selected.push_back(selectOne(manifest, number));
  }
  std::vector<double> before;
  {
    StoreOptions options;
    options.load = false;
    StoreUnderTest store(directory, options);
    for (std::size_t number = 0; number < fetched; ++number) before.push_back(fetchOne(store, number));
  }
  std::vector<double> meanwhile;
  for (std::size_t number = 0; number < 3; ++number) {
    StoreOptions options;
    options.load = false;
    StoreUnderTest store(directory, options);
    store->loadManifest();
    meanwhile.push_back(fetchOne(store, number));
  }
  const double lowerBound = median(loaded) + median(selected);
  const std::string name = "a fetch from " + countName(items) + " items, ";
  context.report.add(Row{name + "not loading yet",
                         place.name,
                         cpuName(false),
                         "us",
                         {{"ours", median(before)}, {"lower bound", lowerBound}},
                         {{"lower bound", 2}}});
  context.report.add(Row{name + "while they load",
                         place.name,
                         cpuName(false),
                         "us",
                         {{"ours", median(meanwhile)}, {"lower bound", lowerBound}},
                         {{"lower bound", 2}}});
}

}  // namespace

void measureStart(const Context& context) {
  for (const Place& place : context.places) measureHost(context, place);
  measureUnloaded(context, context.places.front());
}

}  // namespace velmora::mobile::xplat::cellar::bench
