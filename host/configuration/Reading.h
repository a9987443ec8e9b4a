#pragma once

#include <memory>
#include <string>

namespace velmora::mobile::xplat::cellar {

class Configuration;

namespace host {

// The configuration of a host. Throws what `Configuration` throws, and `ConfigurationException` for managers that would
// share a directory, each of them together with a `ConfigurationError`.
std::shared_ptr<const Configuration> readConfiguration(const std::string& json);

}  // namespace host
}  // namespace velmora::mobile::xplat::cellar
