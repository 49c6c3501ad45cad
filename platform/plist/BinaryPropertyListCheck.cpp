#include "platform/plist/BinaryPropertyListCheck.h"

#include <algorithm>
#include <bit>
#include <cstdint>

#include "platform/plist/PropertyListLimits.h"

namespace platform {

namespace {

constexpr std::size_t kHeaderSize = 8;
constexpr std::size_t kTrailerSize = 32;
/// How many objects, and bytes of strings and data, sharing may add to what the file itself could
/// hold.
constexpr std::size_t kSharedObjects = 1u << 16;
constexpr std::size_t kSharedBytes = 64u << 20;

class Walker {
  public:
    Walker(std::string_view bytes)
        : bytes_(bytes),
          objectsLeft_(std::min(kMaxPropertyListObjects, bytes.size() + kSharedObjects)),
          payloadLeft_(bytes.size() + kSharedBytes) {}

    PropertyListCheck check() {
        visitRoot();
        return std::move(found_);
    }

  private:
    bool visitRoot() {
        if (bytes_.size() < kHeaderSize + kTrailerSize) return fail("truncated");
        std::size_t trailer = bytes_.size() - kTrailerSize;
        offsetSize_ = byte(trailer + 6);
        refSize_ = byte(trailer + 7);
        objectCount_ = number(trailer + 8, 8);
        std::uint64_t root = number(trailer + 16, 8);
        std::uint64_t table = number(trailer + 24, 8);
        if (!isWordSize(offsetSize_) || !isWordSize(refSize_)) return fail("bad trailer");
        if (table < kHeaderSize || table > trailer) return fail("bad trailer");
        if (objectCount_ > (trailer - table) / offsetSize_) return fail("bad trailer");
        table_ = table;
        return visit(root, 1, false);
    }

    /// An object's payload: `count` units from `start` on.
    struct Payload {
        std::uint64_t count;
        std::size_t start;
    };

    static bool isWordSize(std::size_t size) { return (size >= 1 && size <= 4) || size == 8; }
    std::size_t byte(std::size_t at) const { return static_cast<unsigned char>(bytes_[at]); }

    std::uint64_t number(std::size_t at, std::size_t size) const {
        std::uint64_t result = 0;
        for (std::size_t i = 0; i < size; ++i) result = result << 8 | byte(at + i);
        return result;
    }

    bool fail(const char* problem) {
        found_.problem = problem;
        return false;
    }

    /// Whether `count` units of `size` bytes fit between `start` and the offset table.
    bool fits(std::size_t start, std::uint64_t count, std::size_t size) {
        if (start > table_ || count > (table_ - start) / size) return fail("truncated object");
        return true;
    }

    bool visit(std::uint64_t object, int depth, bool isKey) {
        if (object >= objectCount_) return fail("reference to no object");
        if (objectsLeft_-- == 0) return fail("too many objects");
        std::uint64_t at = number(table_ + object * offsetSize_, offsetSize_);
        if (at < kHeaderSize || at >= table_) return fail("object outside the file");
        std::size_t kind = byte(at) >> 4;
        std::size_t size = byte(at) & 0xF;
        if (isKey && kind != 0x5 && kind != 0x6) return fail("key that is not a string");
        switch (kind) {
            case 0x0:
                return size == 0x8 || size == 0x9 || fail("null");
            case 0x1:
                return visitInteger(at + 1, size);
            case 0x2:
                return size == 2 || size == 3 ? fits(at + 1, 1u << size, 1) : fail("bad real");
            case 0x3:
                return size == 3 ? visitDate(at + 1) : fail("bad date");
            case 0x4:
            case 0x5:
            case 0x6:
                return visitBytes(at, kind, size);
            case 0xA:
            case 0xD:
                return visitContainer(at, kind == 0xD, size, depth);
            default:
                return fail("object of an unsupported kind");
        }
    }

    bool visitInteger(std::size_t start, std::size_t size) {
        if (size > 4) return fail("bad integer");
        if (!fits(start, 1u << size, 1)) return false;
        if (size == 4 && number(start, 8) != 0) return fail("integer over 64 bits");
        return true;
    }

    bool visitDate(std::size_t start) {
        if (!fits(start, 8, 1)) return false;
        double seconds = std::bit_cast<double>(number(start, 8));
        found_.dates.push_back({seconds + kPropertyListReferenceDate});
        return true;
    }

    bool readPayload(std::size_t at, std::size_t size, Payload& payload) {
        payload = {size, at + 1};
        if (size != 0xF) return true;
        if (!fits(at + 1, 1, 1)) return false;
        std::size_t marker = byte(at + 1);
        if (marker >> 4 != 0x1 || (marker & 0xF) > 3) return fail("bad count");
        std::size_t width = std::size_t{1} << (marker & 0xF);
        if (!fits(at + 2, width, 1)) return false;
        payload = {number(at + 2, width), at + 2 + width};
        return true;
    }

    bool visitBytes(std::size_t at, std::size_t kind, std::size_t size) {
        Payload payload{};
        std::size_t unit = kind == 0x6 ? 2 : 1;
        if (!readPayload(at, size, payload) || !fits(payload.start, payload.count, unit))
            return false;
        std::size_t length = payload.count * unit;
        if (length > payloadLeft_) return fail("too large when expanded");
        payloadLeft_ -= length;
        return kind == 0x4 || visitText(payload.start, length, unit);
    }

    /// libplist cuts a key at a NUL, and makes nothing of a text with half a surrogate pair.
    bool visitText(std::size_t start, std::size_t length, std::size_t unit) {
        bool inPair = false;
        for (std::size_t i = 0; i < length; i += unit) {
            std::uint64_t character = number(start + i, unit);
            if (character == 0) return fail("string with a NUL");
            bool isLow = character >= 0xDC00 && character < 0xE000;
            if (isLow != inPair) break;
            inPair = character >= 0xD800 && character < 0xDC00;
            if (i + unit == length && !inPair) return true;
        }
        return length == 0 || fail("string with half a surrogate pair");
    }

    bool visitContainer(std::size_t at, bool isDictionary, std::size_t size, int depth) {
        Payload payload{};
        if (depth > kMaxPropertyListFileDepth) return fail("nested too deep");
        if (!readPayload(at, size, payload) ||
            !fits(payload.start, payload.count, isDictionary ? 2 * refSize_ : refSize_))
            return false;
        if (isDictionary) found_.entries += payload.count;
        std::uint64_t references = isDictionary ? 2 * payload.count : payload.count;
        for (std::uint64_t i = 0; i < references; ++i) {
            bool isKey = isDictionary && i < payload.count;
            if (!visit(number(payload.start + i * refSize_, refSize_), depth + 1, isKey))
                return false;
        }
        return true;
    }

    std::string_view bytes_;
    std::size_t objectsLeft_;
    std::size_t payloadLeft_;
    std::size_t offsetSize_ = 0;
    std::size_t refSize_ = 0;
    std::uint64_t objectCount_ = 0;
    std::size_t table_ = 0;
    PropertyListCheck found_;
};

}  // namespace

PropertyListCheck checkBinaryPropertyList(std::string_view bytes) {
    return Walker(bytes).check();
}

}  // namespace platform
