// Texts that others chose, made fit for a terminal. Used by what this program prints for people.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace velk::ctl {

/// `text` with nothing left in it that moves the cursor, begins a line or turns the direction of writing: such
/// characters, and bytes that are no UTF-8, are escaped. Longer than `columns` it is cut and ends in an ellipsis.
[[nodiscard]] std::string printable(std::string_view text, std::size_t columns = SIZE_MAX);

/// How many columns of a terminal the text takes, near enough: every character but marks and joiners takes one, those
/// of the wide scripts two.
[[nodiscard]] std::size_t columnsOf(std::string_view text) noexcept;

}  // namespace velk::ctl
