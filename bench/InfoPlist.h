#pragma once

#include <cstddef>
#include <string>
#include <string_view>

namespace bench {

/// Property lists of generated bundles, as XML, of the shape and size that real bundles have.

std::string applicationInfo(std::size_t number);
/// About 3 KB. `attributes` (XML of keys and values) is added to the attributes dictionary.
std::string plugInInfo(std::size_t number, std::string_view extensionPoint,
                       std::string_view attributes);
std::string plugInEntitlements(std::size_t number);

}  // namespace bench
