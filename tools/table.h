// Plain-text tables for the tool's human-readable output.
#ifndef ZORVNOTIFYD_TOOLS_TABLE_H_
#define ZORVNOTIFYD_TOOLS_TABLE_H_

#include <ostream>
#include <string>
#include <vector>

#include "text.h"

namespace zorvnotifyctl {

// A header row and data rows.  Printed with each column padded to its
// widest cell (counted in UTF-8 characters) and two blanks between
// columns; lines carry no trailing blanks.  Cells are printed as given:
// pass text from queue files through Printable first.
class Table {
 public:
  // A table with these column titles and no rows.
  explicit Table(std::vector<std::string> header);

  // Appends a row.  Missing cells are empty; cells beyond the header's
  // width are dropped.
  void AddRow(std::vector<std::string> cells);

  // True when no row was added.
  bool empty() const { return rows_.size() == 1; }

  // Prints the header and the rows, one line each.
  void Print(std::ostream& out) const;

 private:
  std::vector<std::vector<std::string>> rows_;  // the header first
};

using zorvcommon::Printable;

}  // namespace zorvnotifyctl

#endif  // ZORVNOTIFYD_TOOLS_TABLE_H_
