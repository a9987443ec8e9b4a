#include "DemoSteps.h"

namespace velmora::mobile::xplat::cellar::tools {

std::vector<DemoStep> demoSteps() {
  return {
      {"The first start", firstStart},
      {"Files fill the stores", fillStores},
      {"How much is it?", measureStores},
      {"Asked again", measureStoresAgain},
      {"Values by key: drafts in files, settings in the manifest", storeByKey},
      {"Disk caches are pruned when their manager is over its limit", pruneCaches},
      {"A cache over its limit is evicted at the next start", evictOversizedCache},
      {"After the restart, every value is found again", findAgain},
      {"An update retires the directories of the old release", updateApplication},
      {"Another user, whose start cleans up after the first", changeUser},
      {"A store marked for trashing begins empty at the next start", trashMarkedStore},
      {"A forced cleanse", cleanseEverything},
      {"Trash that a power cut left behind", emptyTrash},
      {"Log-out", logOut},
  };
}

}  // namespace velmora::mobile::xplat::cellar::tools
