#pragma once

#include <string_view>

#include "platform/plist/PropertyListCheck.h"

namespace platform {

/// Looks at the bytes of a binary property list. Every object that the parser would visit is
/// visited: shared objects as often as they are used, so that neither their number nor the size of
/// their contents can explode. The limits are those of PropertyListLimits.h.
///
/// Objects that a Value cannot express (null, UID, set, integers over 64 bits, strings with a NUL,
/// keys that are no strings) are a problem as well.
PropertyListCheck checkBinaryPropertyList(std::string_view bytes);

}  // namespace platform
