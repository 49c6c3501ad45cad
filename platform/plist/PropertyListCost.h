#pragma once

#include <cstddef>

#include "platform/values/Value.h"

namespace platform {

/// What a value takes of the limits of `writeXmlPropertyList` and `parsePropertyList`. For those
/// who put the XML form of a container together from pieces: the costs of its elements add up.
struct PropertyListCost {
    std::size_t objects = 0;
    std::size_t bytes = 0;  // of texts and data in XML
    std::size_t work = 0;   // as PropertyListWork adds it up

    PropertyListCost& operator+=(const PropertyListCost& other);
    PropertyListCost& operator-=(const PropertyListCost& other);
    /// Whether the reader takes what is written, as far as objects and work go.
    bool isReadable() const;
    /// Whether it is within the limits, with half of the objects and of the work left for what
    /// holds the pieces together, and `limit` bytes of XML whatever tags and indentation add. With
    /// `parts`: whether it is within that part of each.
    bool fits(std::size_t limit, std::size_t parts = 1) const;
};
PropertyListCost costOfPropertyList(const Value& value);

}  // namespace platform
