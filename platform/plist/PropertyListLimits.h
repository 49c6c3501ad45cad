#pragma once

#include <cstddef>

namespace platform {

/// Deepest nesting of containers that is read, and the most objects that a list may expand to (a
/// binary list may share objects; each use counts).
inline constexpr int kMaxPropertyListFileDepth = 128;
inline constexpr std::size_t kMaxPropertyListObjects = 1u << 20;
/// Largest file of `readPropertyListFile` and `writeXmlPropertyList` unless the caller says
/// otherwise.
inline constexpr std::size_t kMaxPropertyListFile = 16u << 20;

}  // namespace platform
