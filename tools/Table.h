#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

// Rows of text under a header; each column is as wide as its longest cell.
class Table {
 public:
  enum class Align { Left, Right };

  struct Column {
    std::string title;
    Align align;
  };

  explicit Table(std::vector<Column> columns);

  // One cell for each column, which is made `printable`.
  void addRow(std::vector<std::string> cells);

  // The lines, each indented and with a line end. An empty column still shows its title.
  std::string text() const;

 private:
  std::string line(const std::vector<std::string>& cells) const;

  std::vector<Column> columns_;
  std::vector<std::size_t> widths_;
  std::vector<std::vector<std::string>> rows_;
};

}  // namespace velmora::mobile::xplat::cellar::tools
