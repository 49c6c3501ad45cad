#pragma once

#include <optional>
#include <string_view>

#include "platform/values/Value.h"

namespace platform {

/// What the text of a property list's XML elements may be, without spaces around it.

/// Decimal or hexadecimal, of 64 bits. Not with leading zeros, which the parser takes for octal.
bool isXmlInteger(std::string_view text);
/// Decimal within the range of a double, or an infinity or NaN.
bool isXmlReal(std::string_view text);
/// Base64, with spaces anywhere.
bool isXmlData(std::string_view text);
/// A moment as in 2001-12-31T23:59:59Z.
std::optional<Date> dateOfXml(std::string_view text);

}  // namespace platform
