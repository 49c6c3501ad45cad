#pragma once

#include <cstddef>
#include <string>
#include <string_view>

#include "platform/Error.h"
#include "platform/Value.h"

namespace platform {

/// Property lists in their XML and binary forms, as files hold them. The bytes may be hostile.

/// Deepest nesting of containers that is read, and the most objects that a list may expand to (a
/// binary list may share objects; each use counts).
inline constexpr int kMaxPropertyListFileDepth = 128;
inline constexpr std::size_t kMaxPropertyListObjects = 1u << 20;
/// Most entries of one dictionary: libplist's work grows with the square of their number.
inline constexpr std::size_t kMaxPropertyListEntries = 1u << 17;
/// Largest file of `readPropertyListFile` unless the caller says otherwise.
inline constexpr std::size_t kMaxPropertyListFile = 16u << 20;

/// Reads an XML or binary property list. Size, depth and the number of objects are checked before
/// anything is built. The error (domain "PropertyList") says what is wrong.
Result<Value> parsePropertyList(std::string_view bytes);

/// Reads the file at `path` and parses it. Errors: those of `readFile` (EFBIG for a file over
/// `limit`) and of `parsePropertyList`; the text names the file.
Result<Value> readPropertyListFile(const std::string& path,
                                   std::size_t limit = kMaxPropertyListFile);

/// The XML form of a value. Errors: the value is not a property list (`isPropertyList`), or larger
/// than the limits above. What this writes, `parsePropertyList` reads back equal (dates lose the
/// fraction of their second).
Result<std::string> writeXmlPropertyList(const Value& value);

}  // namespace platform
