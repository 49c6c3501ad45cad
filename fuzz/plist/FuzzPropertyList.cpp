// Whatever is parsed can be written, when it is a property list, and is read back the same.
// Covers: platform/plist/PropertyList.cpp platform/plist/BinaryPropertyListCheck.cpp
// Covers: platform/plist/XmlPropertyListCheck.cpp platform/plist/PropertyListWork.cpp

#include "fuzz/Support.h"
#include "platform/plist/PropertyList.h"

using namespace platform;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    auto value = parsePropertyList(fuzz::text(data, size));
    if (!value || !isPropertyList(*value)) return 0;
    auto text = writeXmlPropertyList(*value);
    fuzz::require(bool(text));
    auto back = parsePropertyList(*text);
    fuzz::require(bool(back));
    auto again = writeXmlPropertyList(*back);
    fuzz::require(again && *again == *text);
    return 0;
}
