#pragma once

#include <string_view>

namespace platform {

/// Says why the bytes of an XML property list must not be handed to a parser, or null when they
/// may: incomplete, followed by something else, over the limits of platform/PropertyList.h (each
/// element is an object), or with markup in which the depth cannot be told for sure (declarations
/// inside the document type, instructions between elements).
const char* problemOfXmlPropertyList(std::string_view bytes);

}  // namespace platform
