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
/// Largest file of `readPropertyListFile` and `writeXmlPropertyList` unless the caller says
/// otherwise.
inline constexpr std::size_t kMaxPropertyListFile = 16u << 20;

/// Reads an XML or binary property list. Depth, the number of objects and the work that they cause
/// (platform/PropertyListWork.h) are checked before anything is built. The error (domain
/// "PropertyList") says what is wrong.
Result<Value> parsePropertyList(std::string_view bytes);

/// Reads the file at `path` and parses it. Errors: those of `readFile` (EFBIG for a file over
/// `limit`) and of `parsePropertyList`; the text names the file.
Result<Value> readPropertyListFile(const std::string& path,
                                   std::size_t limit = kMaxPropertyListFile);

/// The XML form of a value, of at most `limit` bytes (which is at most 1 GiB). Errors: the value is
/// not a property list (`isPropertyList`, at the depth that is read), or over the limits, the
/// reader's among them. What this writes, `parsePropertyList` reads back equal (dates lose the
/// fraction of their second).
Result<std::string> writeXmlPropertyList(const Value& value,
                                         std::size_t limit = kMaxPropertyListFile);

/// What a value takes of the limits of `writeXmlPropertyList` and `parsePropertyList`. For those
/// who put the XML form of a container together from pieces: the costs of its elements add up.
struct PropertyListCost {
    std::size_t objects = 0;
    std::size_t bytes = 0;  // of texts and data in XML
    std::size_t work = 0;   // as platform/PropertyListWork.h has it

    PropertyListCost& operator+=(const PropertyListCost& other);
    PropertyListCost& operator-=(const PropertyListCost& other);
    /// Whether it is within the limits, with half of the objects and of the work left for what
    /// holds the pieces together, and `limit` bytes of XML whatever tags and indentation add.
    bool fits(std::size_t limit) const;
};
PropertyListCost costOfPropertyList(const Value& value);

}  // namespace platform
