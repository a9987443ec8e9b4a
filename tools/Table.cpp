#include "Table.h"

#include <algorithm>
#include <utility>

#include "Printable.h"

namespace velmora::mobile::xplat::cellar::tools {

Table::Table(std::vector<Column> columns) : columns_(std::move(columns)) {
  for (const Column& column : columns_) widths_.push_back(column.title.size());
}

void Table::addRow(std::vector<std::string> cells) {
  cells.resize(columns_.size());
  for (std::size_t i = 0; i < cells.size(); ++i) {
    cells[i] = printable(cells[i]);
    widths_[i] = std::max(widths_[i], cells[i].size());
  }
  rows_.push_back(std::move(cells));
}

std::string Table::text() const {
  std::vector<std::string> titles;
  std::vector<std::string> rules;
  for (std::size_t i = 0; i < columns_.size(); ++i) {
    titles.push_back(columns_[i].title);
    rules.emplace_back(widths_[i], '-');
  }
  std::string text = line(titles) + line(rules);
  for (const auto& row : rows_) text += line(row);
  return text;
}

std::string Table::line(const std::vector<std::string>& cells) const {
  std::string line;
  for (std::size_t i = 0; i < cells.size(); ++i) {
    const std::string padding(widths_[i] - cells[i].size(), ' ');
    line += "  " + (columns_[i].align == Align::Right ? padding + cells[i] : cells[i] + padding);
  }
  return line.substr(0, line.find_last_not_of(' ') + 1) + "\n";
}

}  // namespace velmora::mobile::xplat::cellar::tools
