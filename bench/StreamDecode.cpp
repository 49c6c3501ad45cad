#include "bench/StreamDecode.h"

#include <cbor.h>

#include "bench/Failure.h"
#include "bench/Frames.h"

namespace bench {

namespace {

constexpr std::uint64_t kPackedTag = 24;

struct Reader {
    std::size_t items = 0;
    bool isPacked = false;  // the next byte string holds an item
};

void decodeAll(Reader& reader, const unsigned char* bytes, std::size_t size);

Reader& readerOf(void* context) {
    Reader& reader = *static_cast<Reader*>(context);
    ++reader.items;
    return reader;
}

cbor_callbacks makeCallbacks() {
    cbor_callbacks callbacks = cbor_empty_callbacks;
    callbacks.uint8 = [](void* context, std::uint8_t) { readerOf(context); };
    callbacks.uint16 = [](void* context, std::uint16_t) { readerOf(context); };
    callbacks.uint32 = [](void* context, std::uint32_t) { readerOf(context); };
    callbacks.uint64 = [](void* context, std::uint64_t) { readerOf(context); };
    callbacks.float8 = [](void* context, double) { readerOf(context); };
    callbacks.boolean = [](void* context, bool) { readerOf(context); };
    callbacks.string = [](void* context, cbor_data, std::size_t) { readerOf(context); };
    callbacks.array_start = [](void* context, std::size_t) { readerOf(context); };
    callbacks.map_start = [](void* context, std::size_t) { readerOf(context); };
    callbacks.tag = [](void* context, std::uint64_t tag) {
        readerOf(context).isPacked = tag == kPackedTag;
    };
    callbacks.byte_string = [](void* context, cbor_data bytes, std::size_t size) {
        Reader& reader = readerOf(context);
        if (!reader.isPacked) return;
        reader.isPacked = false;
        decodeAll(reader, bytes, size);
    };
    return callbacks;
}

void decodeAll(Reader& reader, const unsigned char* bytes, std::size_t size) {
    static const cbor_callbacks callbacks = makeCallbacks();
    while (size > 0) {
        const cbor_decoder_result result = cbor_stream_decode(bytes, size, &callbacks, &reader);
        if (result.status != CBOR_DECODER_FINISHED) fail("a reply cannot be decoded");
        bytes += result.read;
        size -= result.read;
    }
}

}  // namespace

std::size_t streamDecode(std::string_view frame) {
    Reader reader;
    decodeAll(reader, reinterpret_cast<const unsigned char*>(frame.data()) + kFrameHead,
              frame.size() - kFrameHead);
    return reader.items;
}

}  // namespace bench
