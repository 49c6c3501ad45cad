#include "zrd/AnnotationText.h"

#include <optional>

#include "platform/PropertyList.h"

namespace zorvan {

using platform::Dictionary;
using platform::Result;
using platform::Value;

namespace {

Dictionary rootOf(const Dictionary& annotations) {
    return {{AnnotationText::kVersionKey, AnnotationText::kVersion},
            {AnnotationText::kDataKey, annotations}};
}

/// A file's text, cut up: what stands before the annotations, they, and what stands behind.
struct Pieces {
    std::string_view head;
    std::vector<std::string_view> annotations;
    std::string_view tail;
};

/// Each annotation begins with its key, on a line indented by two levels, and the last one ends
/// before the end of their dictionary, indented by one. No text in the file can look like either,
/// because its "<" are escaped. None when that is not how it looks.
std::optional<Pieces> cut(std::string_view text) {
    constexpr std::string_view kStart = "\n\t\t<key>";
    constexpr std::string_view kEnd = "\n\t</dict>\n";
    std::size_t start = text.find(kStart);
    const std::size_t end = text.find(kEnd);
    if (start == std::string_view::npos || end == std::string_view::npos || end < start)
        return std::nullopt;
    Pieces pieces{text.substr(0, start + 1), {}, text.substr(end + 1)};
    text = text.substr(0, end + 1);
    while (start != std::string_view::npos) {
        const std::size_t next = text.find(kStart, start + 1);
        const std::size_t after = next == std::string_view::npos ? text.size() : next + 1;
        pieces.annotations.push_back(text.substr(start + 1, after - start - 1));
        start = next;
    }
    return pieces;
}

}  // namespace

Result<std::string> AnnotationText::text(const Dictionary& annotations) {
    if (kept_.empty() || !encodeChanged(annotations)) return encodeAll(annotations);
    // Each may have its place, and still all together be more than could be read back.
    if (!platform::fitsXmlPropertyList(rootOf(annotations), kMaxSize))
        return encodeAll(annotations);
    std::string text = joined();
    return text.size() <= kMaxSize ? Result<std::string>(std::move(text)) : encodeAll(annotations);
}

/// Encodes all, and keeps their texts if these can be told apart.
Result<std::string> AnnotationText::encodeAll(const Dictionary& annotations) {
    kept_.clear();
    changed_.clear();
    Result<std::string> text = platform::writeXmlPropertyList(rootOf(annotations), kMaxSize);
    const auto pieces = text ? cut(*text) : std::nullopt;
    if (!pieces || pieces->annotations.size() != annotations.size()) return text;
    head_ = pieces->head;
    tail_ = pieces->tail;
    const std::string_view* piece = pieces->annotations.data();
    for (const auto& [key, annotation] : annotations)
        kept_.emplace_hint(kept_.end(), key, *piece++);
    return text;
}

/// False when one cannot be encoded by itself; then nothing is said about it that would not be said
/// about all.
bool AnnotationText::encodeChanged(const Dictionary& annotations) {
    for (const std::string& key : changed_) {
        const Value* annotation = annotations.find(key);
        if (!annotation) {
            kept_.erase(key);
            continue;
        }
        const auto text = platform::writeXmlPropertyList(rootOf({{key, *annotation}}), kMaxSize);
        const auto pieces = text ? cut(*text) : std::nullopt;
        if (!pieces || pieces->annotations.size() != 1) return false;
        kept_[key] = pieces->annotations[0];
    }
    changed_.clear();
    return kept_.size() == annotations.size() && !kept_.empty();
}

std::string AnnotationText::joined() const {
    std::size_t size = head_.size() + tail_.size();
    for (const auto& [key, text] : kept_) size += text.size();
    std::string all;
    all.reserve(size);
    all += head_;
    for (const auto& [key, text] : kept_) all += text;
    return all += tail_;
}

}  // namespace zorvan
