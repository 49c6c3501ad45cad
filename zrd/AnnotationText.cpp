#include "zrd/AnnotationText.h"

#include <algorithm>
#include <numeric>

#include "platform/plist/PropertyList.h"

namespace zorvan {

using platform::Dictionary;
using platform::Result;
using platform::Value;

namespace {

Dictionary rootOf(const Dictionary& annotations) {
    return {{AnnotationText::kVersionKey, AnnotationText::kVersion},
            {AnnotationText::kDataKey, annotations}};
}

/// Where a file's text can be cut: before each annotation and after the last one.
///
/// Each annotation begins with its key, on a line indented by two levels, and the last one ends
/// before the end of their dictionary, indented by one. No text in the file can look like either,
/// because its "<" are escaped. Empty when that is not how it looks.
std::vector<std::size_t> cutsOf(std::string_view text) {
    constexpr std::string_view kStart = "\n\t\t<key>";
    constexpr std::string_view kEnd = "\n\t</dict>\n";
    const std::size_t end = text.find(kEnd);
    std::vector<std::size_t> cuts;
    for (std::size_t at = text.find(kStart); at < end; at = text.find(kStart, at + 1))
        cuts.push_back(at + 1);
    if (end == std::string_view::npos || cuts.empty()) return {};
    cuts.push_back(end + 1);
    return cuts;
}

}  // namespace

Result<std::string_view> AnnotationText::text(const Dictionary& annotations,
                                              const platform::PropertyListCost& cost) {
    // Each may be within the limits, and still all together be more than could be read back.
    if (pieces_.empty() || annotations.size() > kMostPieces || !cost.fits(kMaxSize) ||
        !encodeChanged(annotations))
        return encodeAll(annotations);
    return std::string_view(whole_);
}

/// Encodes all, and keeps the pieces if they can be told apart.
Result<std::string_view> AnnotationText::encodeAll(const Dictionary& annotations) {
    pieces_.clear();
    changed_.clear();
    Result<std::string> text = platform::writeXmlPropertyList(rootOf(annotations), kMaxSize);
    if (!text) return text.error();
    whole_ = std::move(*text);
    const std::vector<std::size_t> cuts = cutsOf(whole_);
    if (cuts.size() != annotations.size() + 1) return std::string_view(whole_);
    headSize_ = cuts[0];
    const std::size_t* cut = cuts.data();
    for (const auto& [key, annotation] : annotations) {
        pieces_.push_back({key.string(), cut[1] - cut[0]});
        ++cut;
    }
    return std::string_view(whole_);
}

/// False when that is better done for all: an annotation could not be encoded by itself, or none is
/// left.
bool AnnotationText::encodeChanged(const Dictionary& annotations) {
    for (const std::string& key : changed_) {
        const Value* annotation = annotations.find(key);
        if (!annotation) {
            replacePiece(key, {});
            continue;
        }
        const auto text = platform::writeXmlPropertyList(rootOf({{key, *annotation}}), kMaxSize);
        const auto cuts = text ? cutsOf(*text) : std::vector<std::size_t>();
        if (cuts.size() != 2) return false;
        replacePiece(key, std::string_view(*text).substr(cuts[0], cuts[1] - cuts[0]));
    }
    changed_.clear();
    return !pieces_.empty();
}

/// Puts a piece in the place of the one with its key, if there is one; an empty text is none.
void AnnotationText::replacePiece(const std::string& key, std::string_view text) {
    const auto piece = std::ranges::lower_bound(pieces_, key, {}, &Piece::key);
    const std::size_t place =
        std::accumulate(pieces_.begin(), piece, headSize_,
                        [](std::size_t sum, const Piece& before) { return sum + before.size; });
    const bool exists = piece != pieces_.end() && piece->key == key;
    whole_.replace(place, exists ? piece->size : 0, text);
    if (text.empty()) {
        if (exists) pieces_.erase(piece);
    } else if (exists) {
        piece->size = text.size();
    } else {
        pieces_.insert(piece, {key, text.size()});
    }
}

}  // namespace zorvan
