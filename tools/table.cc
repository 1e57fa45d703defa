// Printing of plain-text tables.

#include "table.h"

#include <algorithm>
#include <utility>

namespace zorvnotifyctl {
namespace {

// Number of UTF-8 characters: every byte that is not a continuation byte.
size_t Width(const std::string& text) {
  return static_cast<size_t>(std::count_if(text.begin(), text.end(), [](char c) {
    return (static_cast<unsigned char>(c) & 0xC0) != 0x80;
  }));
}

}  // namespace

Table::Table(std::vector<std::string> header) { rows_.push_back(std::move(header)); }

void Table::AddRow(std::vector<std::string> cells) {
  cells.resize(rows_.front().size());
  rows_.push_back(std::move(cells));
}

void Table::Print(std::ostream& out) const {
  const size_t columns = rows_.front().size();
  std::vector<size_t> widths(columns, 0);
  for (const auto& row : rows_) {
    for (size_t i = 0; i < columns; ++i) widths[i] = std::max(widths[i], Width(row[i]));
  }
  for (const auto& row : rows_) {
    std::string line;
    for (size_t i = 0; i < columns; ++i) {
      if (i > 0) line += "  ";
      line += row[i];
      if (i + 1 < columns) line.append(widths[i] - Width(row[i]), ' ');
    }
    line.erase(line.find_last_not_of(' ') + 1);
    out << line << '\n';
  }
}

}  // namespace zorvnotifyctl
