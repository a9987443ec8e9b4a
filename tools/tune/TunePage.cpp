#include "tune/TunePage.h"

#include <cstddef>

#include "Markup.h"
#include "tune/TunePlot.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

constexpr const char* kHead = R"html(<!doctype html>
<html lang="en">
<head>
<meta charset="utf-8">
<meta name="viewport" content="width=device-width, initial-scale=1">
<meta name="color-scheme" content="light dark">
<style>
  :root { --ground: #f6f5f2; --card: #ffffff; --ink: #23201c; --quiet: #6b655d; --line: #e6e2da; --accent: #8a2846; }
  @media (prefers-color-scheme: dark) {
    :root { --ground: #171412; --card: #14171d; --ink: #f1ece6; --quiet: #a79e93; --line: #342e29; --accent: #e07a98; } }
  body { margin: 0 auto; max-width: 60rem; padding: 2rem 1.25rem; background: var(--ground); color: var(--ink);
         font: 1rem/1.5 system-ui, sans-serif; font-variant-numeric: tabular-nums; }
  h1 { margin: 0; font-size: clamp(1.25rem, 4vw, 2rem); line-height: 1.2; overflow-wrap: anywhere; }
  .brand { color: var(--accent); font-weight: 700; font-size: 0.8125rem; letter-spacing: 0.08em; text-transform: uppercase; }
  .quiet { margin: 0.25rem 0 0; color: var(--quiet); font-size: 0.875rem; }
  .card { margin-top: 1.25rem; background: var(--card); border: 1px solid var(--line); border-radius: 1rem; padding: 1rem;
          overflow-x: auto; }
  .advice { font-weight: 600; } .card p { margin: 0.25rem 0; } .card svg { display: block; width: 100%; }
  table { width: 100%; border-collapse: collapse; }
  th, td { padding: 0.375rem 0.625rem; border-bottom: 1px solid var(--line); text-align: right; white-space: nowrap; }
  th { color: var(--quiet); font-weight: 500; } tr:last-child td { border-bottom: 0; }
  th:last-child, td:last-child { text-align: left; }
</style>
)html";

std::string element(const std::string& name, const std::string& kind, const std::string& text) {
  const std::string attribute = kind.empty() ? "" : " class=\"" + kind + "\"";
  return "<" + name + attribute + ">" + escapedMarkup(text) + "</" + name + ">\n";
}

std::string tableOf(const TuneTexts& texts) {
  std::string table = "<table>\n<thead><tr>";
  for (const Table::Column& column : texts.columns) table += "<th>" + escapedMarkup(column.title) + "</th>";
  table += "</tr></thead>\n<tbody>\n";
  for (const auto& row : texts.rows) {
    table += "<tr>";
    for (const std::string& cell : row) table += "<td>" + escapedMarkup(cell) + "</td>";
    table += "</tr>\n";
  }
  return table + "</tbody>\n</table>\n";
}

}  // namespace

std::string tuningAsPage(const TuneReport& report) {
  const TuneTexts texts = textsOf(report);
  std::string page = kHead + element("title", "", texts.title) + "</head>\n<body>\n<header>\n";
  page += element("p", "brand", "Cellar: which limit?") + element("h1", "", texts.title);
  for (const std::string& note : texts.notes) page += element("p", "quiet", note);
  page += "</header>\n<section class=\"card\">\n" + element("p", "advice", texts.advice);
  if (!texts.cost.empty()) page += element("p", "", texts.cost);
  page += "</section>\n<section class=\"card\">\n" + tuningAsSvg(report) + "</section>\n";
  return page + "<section class=\"card\">\n" + tableOf(texts) + "</section>\n</body>\n</html>\n";
}

}  // namespace velmora::mobile::xplat::cellar::tools
