#include "demo/DemoSteps.h"

namespace velmora::mobile::xplat::cellar::tools {

std::vector<DemoStep> demoSteps() {
  return {
      {"The first start", firstStart},
      {"Files fill the stores", fillStores},
      {"How much is it?", measureStores},
      {"Asked again", measureStoresAgain},
      {"A cache over its limit is evicted at the next start", evictOversizedCache},
      {"Files stored by key: thumbnails, videos, drafts, settings", storeByKey},
      {"Fetched back in a skewed order", useByKey},
      {"Stopped, and the manifests looked at from outside", lookFromOutside},
      {"Over the limits: disk caches are pruned, a full store makes room", pruneCaches},
      {"After a restart, every value is found again", findAgain},
      {"What has not been used for long expires", expireStale},
      {"A store is cleared", clearStore},
      {"An update retires the directories of the old release", updateApplication},
      {"Another user, whose start cleans up after the first", changeUser},
      {"A store marked for trashing begins empty at the next start", trashMarkedStore},
      {"A forced cleanse", cleanseEverything},
      {"Trash that a power cut left behind", emptyTrash},
      {"Log-out", logOut},
  };
}

}  // namespace velmora::mobile::xplat::cellar::tools
