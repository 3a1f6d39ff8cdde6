#include "tools/ctl/TextTable.h"

#include <algorithm>

#include "tools/ctl/PrintableText.h"

namespace velk::ctl {

void TextTable::addRow(const std::vector<std::string>& cells) {
  std::vector<std::string> row;
  for (std::size_t column = 0; column < _columns.size(); ++column) {
    const bool isLast = column + 1 == _columns.size();
    const std::string cell = column < cells.size() ? cells[column] : std::string();
    row.push_back(cell.empty() ? "-" : printable(cell, isLast ? SIZE_MAX : kMaximumColumns));
  }
  _rows.push_back(std::move(row));
}

std::string TextTable::line(const std::vector<std::string>& cells, const std::vector<std::size_t>& widths) const {
  std::string text;
  for (std::size_t column = 0; column < cells.size(); ++column) {
    const std::string padding(widths[column] - columnsOf(cells[column]), ' ');
    const bool isLast = column + 1 == cells.size();
    if (column > 0) text += "  ";
    if (_columns[column].align == Align::right) text += padding;
    text += cells[column];
    if (_columns[column].align == Align::left && !isLast) text += padding;
  }
  return text;
}

std::string TextTable::text(std::size_t indent) const {
  if (_rows.empty()) return {};
  std::vector<std::string> headings;
  std::vector<std::size_t> widths;
  for (std::size_t column = 0; column < _columns.size(); ++column) {
    headings.emplace_back(_columns[column].heading);
    std::size_t width = columnsOf(headings.back());
    for (const auto& row : _rows) width = std::max(width, columnsOf(row[column]));
    widths.push_back(width);
  }
  const std::string margin(indent, ' ');
  std::string text = margin + line(headings, widths) + "\n";
  for (const auto& row : _rows) text += margin + line(row, widths) + "\n";
  return text;
}

}  // namespace velk::ctl
