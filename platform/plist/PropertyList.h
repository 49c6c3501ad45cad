#pragma once

#include <cstddef>
#include <string>
#include <string_view>

#include "platform/plist/PropertyListLimits.h"
#include "platform/system/Error.h"
#include "platform/values/Value.h"

namespace platform {

/// Property lists in their XML and binary forms, as files hold them. The bytes may be hostile.

/// Reads an XML or binary property list. Depth, the number of objects and the work that they cause
/// (PropertyListWork.h) are checked before anything is built. The error (domain
/// "PropertyList") says what is wrong.
Result<Value> parsePropertyList(std::string_view bytes);

/// Reads the file at `path` and parses it. Errors: those of `readFile` (EFBIG for a file over
/// `limit`) and of `parsePropertyList`; the text names the file.
Result<Value> readPropertyListFile(const std::string& path,
                                   std::size_t limit = kMaxPropertyListFile);

/// The same for a file that must lie beneath the directory `dirfd` (borrowed). Errors also: those
/// of `openBeneath`.
Result<Value> readPropertyListBeneath(int dirfd, const std::string& name,
                                      std::size_t limit = kMaxPropertyListFile);

/// The XML form of a value, of at most `limit` bytes (which is at most 1 GiB). Errors: the value is
/// not a property list (`isPropertyList`, at the depth that is read), or over the limits, the
/// reader's among them. What this writes, `parsePropertyList` reads back equal (dates lose the
/// fraction of their second).
Result<std::string> writeXmlPropertyList(const Value& value,
                                         std::size_t limit = kMaxPropertyListFile);

}  // namespace platform
