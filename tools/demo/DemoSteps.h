#pragma once

#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

class DemoContext;

// One scene of the demonstration: does something, says what happened, and checks it.
struct DemoStep {
  std::string title;
  void (*run)(DemoContext& context);
};

// The whole story in its order; each step goes on where the one before it has left the application.
std::vector<DemoStep> demoSteps();

// Filling and measuring (DemoMeasuringSteps.cpp).
void firstStart(DemoContext& context);
void fillStores(DemoContext& context);
void measureStores(DemoContext& context);
void measureStoresAgain(DemoContext& context);
void evictOversizedCache(DemoContext& context);

// Stores with keys: storing and fetching (DemoStoringSteps.cpp).
void storeByKey(DemoContext& context);
void useByKey(DemoContext& context);
void findAgain(DemoContext& context);

// Their manifests (DemoManifestSteps.cpp).
void lookFromOutside(DemoContext& context);

// Their limits (DemoPruningSteps.cpp).
void pruneCaches(DemoContext& context);

// Age, and clearing (DemoExpirySteps.cpp).
void expireStale(DemoContext& context);
void clearStore(DemoContext& context);

// What comes to an end, and how its data goes (DemoCleaningSteps.cpp).
void updateApplication(DemoContext& context);
void changeUser(DemoContext& context);
void trashMarkedStore(DemoContext& context);
void cleanseEverything(DemoContext& context);
void emptyTrash(DemoContext& context);
void logOut(DemoContext& context);

}  // namespace velmora::mobile::xplat::cellar::tools
