#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace zrctl::terminal {

/// Makes the process read and measure text as UTF-8, whatever the user's locale; nothing else of
/// the locale changes. Once, before any other operation here and before there are threads.
void useUtf8();

/// `text` as it may be written to a terminal: what could steer the terminal or reorder its line
/// (control characters, line separators, directional marks) and bytes that are no UTF-8 appear as
/// "\u{1b}" and "\x{ff}".
std::string safe(std::string_view text);

/// The columns that safe text takes.
std::size_t width(const std::string& text);

}  // namespace zrctl::terminal
