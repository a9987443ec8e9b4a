#pragma once

#include <string>

namespace velmora::mobile::xplat::cellar::tools {

// The page without its figures; empty in a build that has none. Made at build time, see cmake/EmbedPage.cmake.
extern const char* const kPageTemplate;

// Throws `InputError` when this build has no page.
void requirePage();

// One page that needs nothing beside itself, with the survey (JSON text) in it.
std::string pageOf(const std::string& survey);

}  // namespace velmora::mobile::xplat::cellar::tools
