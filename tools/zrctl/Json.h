#pragma once

#include <string>

#include "platform/values/Value.h"

namespace zrctl {

/// The JSON text of a value, indented, with a final line feed. Keys are in byte order; data is
/// base64, a date an ISO 8601 text in UTC, a UUID its text.
std::string jsonText(const platform::Value& value);

/// A date as ISO 8601 text in UTC, without fractions of a second; as a number of seconds since 1970
/// when it lies outside the calendar.
std::string dateText(platform::Date date);

}  // namespace zrctl
