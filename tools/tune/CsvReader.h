#pragma once

#include <functional>
#include <string>
#include <vector>

namespace velmora::mobile::xplat::cellar::tools {

class LineReader;
class Trace;

// The meaning of the columns of a table. Columns without a name are absent.
struct CsvColumns {
  std::string key;
  std::string size;         // bytes; an empty cell is a size that is not known
  std::string time;         // seconds
  std::string op;           // what is done; every operation that neither list below names is a fetch
  std::string chunkSecond;  // of a video download
  std::string itemType;
  std::vector<std::string> stores;   // operations that store, for example "2a"
  std::vector<std::string> removes;  // operations that remove
  std::vector<std::string> clears;   // operations that remove all items, whatever their key
};

// Appends the accesses in the table, whose first line names its columns, to the trace. Cells are separated by commas
// and may be in double quotes. Throws `InputError`, naming file and line, for a missing column and a cell that is not a
// number. `onLine` is called after each line.
void readCsv(LineReader& lines, const CsvColumns& columns, Trace& trace, const std::function<void()>& onLine);

}  // namespace velmora::mobile::xplat::cellar::tools
