#pragma once

namespace velmora::mobile::xplat::cellar::tools {

class DemoContext;

// The tables at the end of the demonstration.
void printStores(DemoContext& context);  // while the application is running
void printValues(DemoContext& context);
void printEvents(DemoContext& context);

}  // namespace velmora::mobile::xplat::cellar::tools
