#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// The pages without the documents that they show. Generated at build time, see cmake/EmbedPages.cmake.
extern const char* const kInspectPage;
extern const char* const kTunePage;

// One page that needs no other files: it contains its document (JSON text) and the chart library.
std::string pageOf(const char* page, const std::string& document);

}  // namespace velmora::mobile::xplat::cellar::tools
