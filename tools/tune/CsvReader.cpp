#include "tune/CsvReader.h"

#include <algorithm>
#include <charconv>
#include <cstddef>
#include <cstdint>
#include <limits>
#include <optional>
#include <system_error>

#include "tune/Access.h"
#include "tune/LineReader.h"
#include "tune/Trace.h"

namespace velmora::mobile::xplat::cellar::tools {

namespace {

using Cells = std::vector<std::string>;

// A quote within quotes is written twice.
void split(const std::string& line, Cells& cells) {
  cells.assign(1, "");
  bool isQuoted = false;
  for (std::size_t i = 0; i < line.size(); ++i) {
    const char character = line[i];
    if (character == '"') {
      if (isQuoted && i + 1 < line.size() && line[i + 1] == '"') {
        cells.back() += line[++i];
      } else {
        isQuoted = !isQuoted;
      }
    } else if (character == ',' && !isQuoted) {
      cells.emplace_back();
    } else {
      cells.back() += character;
    }
  }
}

// The positions of the columns.
class Layout {
 public:
  Layout(const LineReader& lines, const Cells& header, const CsvColumns& columns)
      : key(find(lines, header, columns.key)),
        size(find(lines, header, columns.size)),
        time(find(lines, header, columns.time)),
        op(find(lines, header, columns.op)),
        chunkSecond(find(lines, header, columns.chunkSecond)),
        itemType(find(lines, header, columns.itemType)) {}

  using Place = std::optional<std::size_t>;
  const Place key;
  const Place size;
  const Place time;
  const Place op;
  const Place chunkSecond;
  const Place itemType;

 private:
  static Place find(const LineReader& lines, const Cells& header, const std::string& name) {
    if (name.empty()) return std::nullopt;
    const auto found = std::find(header.begin(), header.end(), name);
    if (found == header.end()) lines.fail("there is no column '" + name + "'");
    return static_cast<std::size_t>(found - header.begin());
  }
};

class Row {
 public:
  Row(const LineReader& lines, const Cells& cells) : lines_(lines), cells_(cells) {}

  // Empty if the column is absent.
  std::string text(const Layout::Place& place) const {
    if (!place) return "";
    if (*place >= cells_.size()) lines_.fail("there are only " + std::to_string(cells_.size()) + " cells");
    return cells_[*place];
  }

  // A whole number; decimals are ignored.
  std::optional<std::int64_t> number(const Layout::Place& place, const char* what, std::int64_t least,
                                     std::int64_t most) const {
    const std::string cell = text(place);
    if (cell.empty()) return std::nullopt;
    std::int64_t value = 0;
    const char* const end = cell.data() + cell.size();
    const auto [rest, error] = std::from_chars(cell.data(), end, value);
    const bool isWhole = error == std::errc() && (rest == end || isFraction(rest, end));
    if (!isWhole || value < least || value > most) lines_.fail("'" + cell + "' is not a " + what);
    return value;
  }

 private:
  static bool isFraction(const char* rest, const char* end) {
    return *rest == '.' && std::all_of(rest + 1, end, [](char digit) { return digit >= '0' && digit <= '9'; });
  }

  const LineReader& lines_;
  const Cells& cells_;
};

AccessKind kindOf(const std::string& op, const CsvColumns& columns) {
  const auto among = [&](const Cells& ops) { return std::find(ops.begin(), ops.end(), op) != ops.end(); };
  if (among(columns.stores)) return AccessKind::Store;
  if (among(columns.clears)) return AccessKind::Clear;
  return among(columns.removes) ? AccessKind::Remove : AccessKind::Fetch;
}

Access readAccess(const Row& row, const Layout& layout, const CsvColumns& columns) {
  constexpr std::int64_t mostBytes = std::int64_t{1} << 50;
  constexpr std::int64_t mostSeconds = std::int64_t{1} << 50;
  constexpr std::int64_t mostInt = std::numeric_limits<std::int32_t>::max();
  Access access;
  access.size = row.number(layout.size, "size in bytes", 0, mostBytes).value_or(Access::kUnknownSize);
  access.date = row.number(layout.time, "time in seconds", -mostSeconds, mostSeconds).value_or(0);
  if (layout.op) access.kind = kindOf(row.text(layout.op), columns);
  const auto second = row.number(layout.chunkSecond, "second of a video", -mostInt, mostInt);
  const auto type = row.number(layout.itemType, "valid item type", 0, mostInt);
  if (second || type) {
    access.chunkSecond = static_cast<std::int32_t>(second.value_or(0));
    access.itemType = static_cast<std::int32_t>(type.value_or(0));
  }
  return access;
}

}  // namespace

void readCsv(LineReader& lines, const CsvColumns& columns, Trace& trace, const std::function<void()>& onLine) {
  std::string line;
  Cells cells;
  if (!lines.next(line)) return;
  split(line, cells);
  const Layout layout(lines, cells, columns);
  for (; lines.next(line); onLine()) {
    if (line.empty()) continue;
    split(line, cells);
    const Row row(lines, cells);
    const Access access = readAccess(row, layout, columns);
    if (access.kind == AccessKind::Clear) {
      trace.appendClear(access.date);
    } else {
      lines.naming([&] { trace.append(row.text(layout.key), access); });
    }
  }
}

}  // namespace velmora::mobile::xplat::cellar::tools
