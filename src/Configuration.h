#pragma once

#include <memory>
#include <string>
#include <unordered_map>

#include "Export.h"
#include "StoreDefinition.h"

namespace velmora::mobile::xplat::cellar {

// All managers and stores of an application, read once from one JSON document. Immutable: lookups may run on any
// thread.
//
// Sizes ("20MB": B, KB, MB, GB, powers of 1024) and durations ("1 hours": minutes, hours, days, years of 365 days) are
// computed in unsigned 32-bit arithmetic and wrap: "4GB" is 0 bytes. Unknown keys are ignored. `capacity` counts only
// when it is a JSON integer; any other key of the wrong JSON type is an error.
class CELLAR_EXPORT Configuration {
 public:
  // Reads the document. With several faults, the first in document order is reported, and within a manager or store the
  // first in the order in which docs/architecture.md lists the keys. Throws `std::invalid_argument` for an unknown
  // area, type, factory, strategy or unit; `ConfigurationException` for a manager name or a store identifier (across
  // all managers) that is met twice; and the JSON library's own exceptions for text that is not JSON, values of the
  // wrong JSON type, and a store without "type".
  explicit Configuration(const std::string& json);

  // Takes ready definitions. Checks nothing: of two stores with one identifier either may be the one that `getStore`
  // finds.
  explicit Configuration(
      const std::unordered_map<std::string, std::shared_ptr<const StoreManagerDefinition>>& managers);

  // The store with that identifier, of whichever manager. Throws `ConfigurationException` when there is none.
  virtual std::shared_ptr<const StoreDefinition> getStore(const std::string& identifier) const;

  // The manager of that name. Throws `ConfigurationException` when there is none.
  virtual std::shared_ptr<const StoreManagerDefinition> getManager(const std::string& name) const;

 private:
  std::unordered_map<std::string, std::shared_ptr<const StoreManagerDefinition>> managers_;
  std::unordered_map<std::string, std::shared_ptr<const StoreDefinition>> storeDefinitions_;
};

}  // namespace velmora::mobile::xplat::cellar
