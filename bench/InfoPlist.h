#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace bench {

/// Property lists of generated bundles, as XML, of the shape and size that real bundles have.

std::string applicationInfo(std::size_t number);
/// About 3 KB, or, without what building leaves in it, a good 1 KB less. `attributes` (XML of keys
/// and values) is added to the attributes dictionary.
std::string plugInInfo(std::size_t number, std::string_view extensionPoint,
                       std::string_view attributes, bool isLean = false);
std::string plugInEntitlements(std::size_t number);

}  // namespace bench
