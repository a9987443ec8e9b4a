#pragma once

#include <string>

#include "support/Report.h"

namespace velmora::mobile::xplat::cellar::bench {

// Replaces what stands in a document between "<!-- begin: NAME -->" and "<!-- end: NAME -->". Throws
// `std::runtime_error` when it has no such place.
std::string withSection(const std::string& document, const std::string& name, const std::string& content);

// Takes the tables over into the document, each topic's where the document has its name, and what they were measured
// with where it has "environment".
void recordTables(const Report& report, const std::string& documentPath);

// Writes a script for each plot into a directory; run by gnuplot, it prints the plot.
void writePlotScripts(const Report& report, const std::string& directory);

}  // namespace velmora::mobile::xplat::cellar::bench
