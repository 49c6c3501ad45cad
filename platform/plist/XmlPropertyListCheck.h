#pragma once

#include <string_view>

#include "platform/plist/PropertyListCheck.h"

namespace platform {

/// Looks at the bytes of an XML property list. A problem is: whatever is no complete list of one
/// value, over the limits of PropertyListLimits.h (each element is an object), markup in which
/// the depth cannot be told for sure (declarations inside the document type, instructions between
/// elements), and text that is not what its element says, of which the parser would make something
/// else. What is inside strings and keys is left to the parser.
PropertyListCheck checkXmlPropertyList(std::string_view bytes);

}  // namespace platform
