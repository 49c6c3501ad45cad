#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace platform {

/// Compares two version texts, `receiver` with `other`: -1 ascending, 0 same, +1 descending. Runs
/// of the digits 0 to 9 compare by their numeric value, however long and with or without leading
/// zeros; every other byte compares by value, case-sensitively; the first difference decides, and a
/// text that ends first comes first.
int compareVersionString(std::string_view receiver, std::string_view other);

/// The form that all version texts which compare as the same have in common, and no others: without
/// leading zeros. None when it has more than `limit` bytes.
std::optional<std::string> canonicalVersionString(std::string_view text,
                                                  std::size_t limit = std::string::npos);

}  // namespace platform
