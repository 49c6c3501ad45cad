// Whatever is decoded is encoded to bytes that decode to the same and stay the same, whether or not
// dictionaries carry them.
// Covers: platform/values/Cbor.cpp platform/values/CborDecoder.cpp platform/values/CborHead.cpp
// platform/values/Decoded.cpp platform/values/Utf8.cpp platform/values/ValueDescription.cpp

#include "fuzz/Support.h"
#include "platform/values/Cbor.h"
#include "platform/values/SliceList.h"

using namespace platform;

namespace {

std::shared_ptr<const std::string> encoded(const Value& value) {
    std::string bytes;
    encodeCbor(value, bytes);
    return std::make_shared<const std::string>(std::move(bytes));
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    auto value = decodeCbor(std::make_shared<const std::string>(fuzz::text(data, size)));
    if (!value) return 0;
    auto bytes = encoded(*value);
    auto again = decodeCbor(bytes, CborOptions::KeepEncoded);
    fuzz::require(bool(again));
    fuzz::require(*encoded(*again) == *bytes);
    auto plain = decodeCbor(bytes);
    fuzz::require(plain && *encoded(*plain) == *bytes);
    fuzz::require(describe(*again) == describe(*value));
    if (const Dictionary* dictionary = plain->dictionary()) {
        keepCborEncoded(*dictionary);
        fuzz::require(*encoded(*plain) == *bytes);
        SliceList slices;
        encodeCbor(*dictionary, slices);
        fuzz::require(slices.string() == *bytes);
        (void)describeWhole(*dictionary);
    }
    if (const Array* array = plain->array()) fuzz::require(describe(*array) == describe(*value));
    if (const Packed* packed = value->packed()) (void)unpack(*packed);
    return 0;
}
