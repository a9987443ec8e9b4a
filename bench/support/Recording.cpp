#include "support/Recording.h"

#include <sqlite3.h>
#include <sys/utsname.h>

#include <filesystem>
#include <fstream>
#include <iterator>
#include <sstream>
#include <stdexcept>
#include <thread>

namespace velmora::mobile::xplat::cellar::bench {

namespace {

std::string environmentText() {
  utsname system{};
  (void)::uname(&system);
  std::ostringstream text;
  text << "Recorded on a " << system.machine << " machine with " << std::thread::hardware_concurrency() << " CPUs, "
       << system.sysname << " " << system.release << ", g++ " << __VERSION__ << ", SQLite " << sqlite3_libversion()
       << ".\n";
  return text.str();
}

std::string plotCommand(const Plot& plot) {
  std::string command = "plot";
  for (const auto& [name, points] : plot.lines) {
    command += (command == "plot" ? " $" : ", $") + std::string("data") + " index \"" + name +
               "\" using 1:2 with linespoints title \"" + name + "\"";
  }
  return command + "\n";
}

std::string scriptOf(const Plot& plot) {
  std::ostringstream script;
  script << "$data << END\n";
  for (const auto& [name, points] : plot.lines) {
    script << "# " << name << "\n";
    for (const auto& [x, y] : points) script << x << " " << y << "\n";
    script << "\n\n";
  }
  script << "END\n"
         << "set terminal svg size 720,400 background rgb \"white\"\n"
         << "set title \"" << plot.title << "\"\n"
         << "set xlabel \"" << plot.xLabel << "\"\nset ylabel \"" << plot.yLabel << "\"\n"
         << "set logscale x\n"
         << (plot.logarithmicY ? "set logscale y\n" : "set yrange [0:*]\n") << "set grid\nset key outside\n"
         << plotCommand(plot);
  return script.str();
}

std::string beginOf(const std::string& name) { return "<!-- begin: " + name + " -->\n"; }
std::string endOf(const std::string& name) { return "<!-- end: " + name + " -->\n"; }

std::string textOf(const std::string& path) {
  std::ifstream file(path);
  return {std::istreambuf_iterator<char>(file), {}};
}

void write(const std::string& document, const std::string& path) {
  std::ofstream file(path);
  file << document;
  if (!file.flush()) throw std::runtime_error("cannot write " + path);
}

}  // namespace

std::string withSection(const std::string& document, const std::string& name, const std::string& content) {
  const auto first = document.find(beginOf(name));
  const auto last = document.find(endOf(name), first);
  if (first == std::string::npos || last == std::string::npos) {
    throw std::runtime_error("the document has no place for '" + name + "'");
  }
  return document.substr(0, first + beginOf(name).size()) + content + document.substr(last);
}

void recordTables(const Report& report, const std::string& documentPath) {
  std::string document = withSection(textOf(documentPath), "environment", environmentText());
  for (const auto& section : report.sections()) document = withSection(document, section.name, tableMarkdown(section));
  write(document, documentPath);
}

void recordSummaries(const Report& report, const std::string& documentPath) {
  std::string document = withSection(textOf(documentPath), "environment", environmentText());
  for (const auto& section : report.sections()) {
    if (document.find(beginOf(section.name)) == std::string::npos) continue;
    document = withSection(document, section.name, summaryMarkdown(section));
  }
  write(document, documentPath);
}

void writePlotScripts(const Report& report, const std::string& directory) {
  std::filesystem::create_directories(directory);
  for (const Plot& plot : report.plots()) {
    std::ofstream file(directory + "/" + plot.name + ".gnuplot");
    file << scriptOf(plot);
    if (!file.flush()) throw std::runtime_error("cannot write the script of " + plot.name);
  }
}

}  // namespace velmora::mobile::xplat::cellar::bench
