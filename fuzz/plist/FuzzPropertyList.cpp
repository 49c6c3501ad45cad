// Whatever is parsed can be written, when it is a property list, and is read back the same.

#include <cstdlib>

#include "platform/plist/PropertyList.h"

using namespace platform;

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    auto value = parsePropertyList({reinterpret_cast<const char*>(data), size});
    if (!value || !isPropertyList(*value)) return 0;
    auto text = writeXmlPropertyList(*value);
    if (!text) std::abort();
    auto back = parsePropertyList(*text);
    if (!back) std::abort();
    auto again = writeXmlPropertyList(*back);
    if (!again || *again != *text) std::abort();
    return 0;
}
