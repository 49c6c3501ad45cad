// Whatever is decoded is encoded to bytes that decode to the same and stay the same, whether or not
// dictionaries carry them.

#include <cstdlib>

#include "platform/values/Cbor.h"

using namespace platform;

namespace {

void require(bool condition) {
    if (!condition) std::abort();
}

std::shared_ptr<const std::string> encoded(const Value& value) {
    std::string bytes;
    encodeCbor(value, bytes);
    return std::make_shared<const std::string>(std::move(bytes));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    auto input = std::make_shared<const std::string>(reinterpret_cast<const char*>(data), size);
    auto value = decodeCbor(input);
    if (!value) return 0;
    auto bytes = encoded(*value);
    auto again = decodeCbor(bytes, CborOptions::KeepEncoded);
    require(static_cast<bool>(again));
    require(*encoded(*again) == *bytes);
    auto plain = decodeCbor(bytes);
    require(static_cast<bool>(plain) && *encoded(*plain) == *bytes);
    require(describe(*again) == describe(*value));
    if (const Packed* packed = value->packed()) (void)unpack(*packed);
    return 0;
}
