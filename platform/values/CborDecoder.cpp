#include "platform/values/CborDecoder.h"

#include <fmt/format.h>

#include <algorithm>
#include <utility>

#include "platform/values/CborTags.h"
#include "platform/values/Utf8.h"

namespace platform {

namespace {

/// Containers of up to so many get their nodes' memory before these have been seen. A lie ends the
/// decoding, so there are never more of them than containers can be nested.
constexpr std::uint64_t kMaxTrusted = 256;

constexpr auto keyOf = [](const Dictionary::Entry& entry) { return entry.first.view(); };

/// Whether no key is there twice. What encoders write is sorted already.
bool sortByKey(std::span<Dictionary::Entry> entries) {
    const auto areSorted = [entries] {
        return std::ranges::adjacent_find(entries, std::ranges::greater_equal(), keyOf) ==
               entries.end();
    };
    if (areSorted()) return true;
    std::ranges::sort(entries, {}, keyOf);
    return areSorted();
}

template <class T>
bool set(Value& value, T content) {
    value = Value(std::move(content));
    return true;
}

}  // namespace

CborDecoder::CborDecoder(const EncodedBytes& bytes, CborOptions options,
                         std::optional<std::size_t> maxValues)
    : bytes_(bytes.bytes),
      keepEncoded_(options == CborOptions::KeepEncoded),
      valuesLeft_(maxValues.value_or(kMaxCborValues + bytes.bytes.size() / 8)),
      memory_(new Decoded(bytes.owner)),
      kept_(memory_) {}

Result<Value> CborDecoder::decode() {
    Value value(false);
    bool good = read(value, 1);
    if (good && position_ != bytes_.size()) good = fail("more bytes after the item");
    if (good) return Value(std::as_const(value));  // the copy keeps the memory
    return Error{"Cbor", 1, fmt::format("{} at offset {}", wrong_, start_)};
}

bool CborDecoder::readHead(CborHead& head) {
    start_ = position_;
    const char* wrong = head.read(bytes_, position_);
    return !wrong || fail(wrong);
}

bool CborDecoder::read(Value& value, int depth) {
    if (valuesLeft_-- == 0) return fail("too many values");
    CborHead head;
    if (!readHead(head)) return false;
    switch (head.kind) {
        case CborHead::Kind::Unsigned:
            return set(value, head.number);
        case CborHead::Kind::Negative:
            if (head.number > INT64_MAX) return fail("an integer below -2^63");
            return set(value, -1 - static_cast<std::int64_t>(head.number));
        case CborHead::Kind::Bytes:
            return set(value, Data(Bytes(within(), head.string)));
        case CborHead::Kind::Text:
            return isText(head.string) && set(value, Text(Bytes(within(), head.string)));
        case CborHead::Kind::Array:
            return readArray(value, head.number, depth);
        case CborHead::Kind::Map:
            return readMap(value, head.number, depth);
        case CborHead::Kind::Tag:
            return readTagged(value, head.number);
        case CborHead::Kind::Real:
            return set(value, head.real);
        case CborHead::Kind::Boolean:
            return set(value, head.number != 0);
    }
    return false;
}

bool CborDecoder::isText(std::string_view text) {
    switch (textFault(text)) {
        case TextFault::None:
            return true;
        case TextFault::NotInXml:
            isPropertyList_ = false;
            return true;
        case TextFault::Nul:
            return fail("a text string with a NUL");
        case TextFault::NotUtf8:
            return fail("a text string that is not UTF-8");
    }
    return false;
}

template <class Node, class ReadNode>
Node* CborDecoder::readNodes(std::uint64_t count, std::vector<Node>& stack, const Node& none,
                             ReadNode readNode) {
    if (count <= kMaxTrusted) {
        Node* nodes = memory_->make(static_cast<std::size_t>(count), none);
        for (std::uint64_t i = 0; i < count; ++i)
            if (!readNode(nodes[i])) return nullptr;
        return nodes;
    }
    const std::size_t base = stack.size();
    for (std::uint64_t i = 0; i < count; ++i) {
        Node node = none;
        if (!readNode(node)) return nullptr;
        stack.push_back(std::move(node));
    }
    Node* nodes = memory_->keep(std::span(stack).subspan(base));
    stack.resize(base, none);
    return nodes;
}

bool CborDecoder::readArray(Value& value, std::uint64_t count, int depth) {
    if (depth > kMaxCborDepth) return fail("nested too deep");
    if (count > left()) return fail("truncated");
    if (count == 0) return set(value, Array());
    const Value* nodes = readNodes(count, values_, Value(false),
                                   [&](Value& element) { return read(element, depth + 1); });
    return nodes && set(value, Array(within(), nodes, static_cast<std::size_t>(count)));
}

bool CborDecoder::readEntry(Dictionary::Entry& entry, int depth) {
    CborHead key;
    if (!readHead(key)) return false;
    if (key.kind != CborHead::Kind::Text) return fail("a key that is no text string");
    if (!isText(key.string)) return false;
    entry.first = Text(Bytes(within(), key.string));
    return read(entry.second, depth);
}

bool CborDecoder::readMap(Value& value, std::uint64_t count, int depth) {
    const std::size_t start = start_;
    if (depth > kMaxCborDepth) return fail("nested too deep");
    if (count > left() / 2) return fail("truncated");
    if (count == 0) return set(value, Dictionary());
    Dictionary::Entry* entries =
        readNodes(count, entries_, Dictionary::Entry(Text(), false),
                  [&](Dictionary::Entry& entry) { return readEntry(entry, depth + 1); });
    if (!entries) return false;
    const std::span all(entries, static_cast<std::size_t>(count));
    if (!sortByKey(all)) {
        start_ = start;
        return fail("a map with the same key twice");
    }
    Dictionary::Nodes nodes{entries, all.size(), {}};
    if (keepEncoded_) nodes.encoded = bytes_.substr(start, position_ - start);
    return set(value, Dictionary(within(), memory_->make(1, nodes)));
}

bool CborDecoder::readTagged(Value& value, std::uint64_t tag) {
    if (tag != kCborDateTag && tag != kCborPackedTag && tag != kCborUuidTag)
        return fail("an unknown tag");
    CborHead content;
    if (!readHead(content)) return false;
    if (tag == kCborDateTag) return readDate(value, content);
    if (content.kind != CborHead::Kind::Bytes) return fail("a tag on the wrong kind of item");
    isPropertyList_ = false;
    if (tag == kCborPackedTag) return set(value, Packed(Bytes(within(), content.string)));
    Uuid uuid;
    if (content.string.size() != uuid.bytes.size()) return fail("a UUID of the wrong length");
    std::ranges::copy(content.string, uuid.bytes.begin());
    return set(value, uuid);
}

bool CborDecoder::readDate(Value& value, const CborHead& content) {
    Date date{static_cast<double>(content.number)};
    if (content.kind == CborHead::Kind::Negative) {
        date.secondsSince1970 = -1 - date.secondsSince1970;
    } else if (content.kind == CborHead::Kind::Real) {
        date.secondsSince1970 = content.real;
    } else if (content.kind != CborHead::Kind::Unsigned) {
        return fail("a tag on the wrong kind of item");
    }
    isPropertyList_ = isPropertyList_ && isPropertyList(date);
    return set(value, date);
}

}  // namespace platform
