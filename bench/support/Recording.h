#pragma once

#include <string>

#include "support/Report.h"

namespace velmora::mobile::xplat::cellar::bench {

// Replaces what is between "<!-- begin: NAME -->" and "<!-- end: NAME -->" in a document. Throws `std::runtime_error`
// when the document has no such place.
std::string withSection(const std::string& document, const std::string& name, const std::string& content);

// Writes the tables into the document, which has a place for each section's name, and what they were measured with
// into its place "environment".
void recordTables(const Report& report, const std::string& documentPath);

// The same with the summaries of the tables, for those sections that the document has a place for.
void recordSummaries(const Report& report, const std::string& documentPath);

// Writes a script for each plot into a directory; run by gnuplot, it prints the plot.
void writePlotScripts(const Report& report, const std::string& directory);

}  // namespace velmora::mobile::xplat::cellar::bench
