#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// The pages without the documents that they show. Made at build time, see cmake/EmbedPages.cmake.
extern const char* const kInspectPage;
extern const char* const kTunePage;

// One page that needs nothing beside itself: with its document (JSON text) and the chart library in it.
std::string pageOf(const char* page, const std::string& document);

}  // namespace velmora::mobile::xplat::cellar::tools
