// A table for people: a line of headings, columns as wide as what stands in them, two blanks between.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

namespace velk::ctl {

/// Used by one thread.
class TextTable {
 public:
  enum class Align : unsigned char { left, right };
  struct Column {
    std::string_view heading;
    Align align = Align::left;
  };

  /// No cell is wider than this but those of the last column, which has the rest of the line to itself.
  static constexpr std::size_t kMaximumColumns = 40;

  explicit TextTable(std::vector<Column> columns) : _columns(std::move(columns)) {}

  /// As many cells as there are columns. What they hold is made printable; an empty one reads "-".
  void addRow(const std::vector<std::string>& cells);

  /// Each line begins with `indent` blanks and ends in a line's end. Nothing without rows.
  [[nodiscard]] std::string text(std::size_t indent) const;

 private:
  [[nodiscard]] std::string line(const std::vector<std::string>& cells, const std::vector<std::size_t>& widths) const;

  const std::vector<Column> _columns;
  std::vector<std::vector<std::string>> _rows;
};

}  // namespace velk::ctl
