#pragma once

#include <cstdint>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/plist/PropertyListCost.h"
#include "platform/system/Error.h"
#include "platform/values/Value.h"

namespace zorvan {

/// The text of the annotation file. Keeps the text of every annotation, so that after a change only
/// that one is encoded anew: with thousands stored, encoding all takes several times as long as
/// getting the file onto the disk.
///
/// Owned and used by the annotation store.
class AnnotationText {
  public:
    static constexpr std::int64_t kVersion = 16;
    static constexpr const char* kVersionKey = "version";
    static constexpr const char* kDataKey = "data";
    static constexpr std::size_t kMaxSize = 256u << 20;
    /// With more annotations than this the keys alone may be too much work for the reader.
    static constexpr std::size_t kMostPieces = 40'000;

    /// Says that the annotation under a key is another one now, or gone. Without a key: all are.
    void changed(std::string_view key) { changed_.emplace(key); }
    void allChanged() { pieces_.clear(); }

    /// The text for all annotations as they are now, which is good until the next change. `cost` is
    /// theirs, each with its key. Errors: those of `writeXmlPropertyList`.
    platform::Result<std::string_view> text(const platform::Dictionary& annotations,
                                            const platform::PropertyListCost& cost);

  private:
    /// The text of one annotation, which is a piece of the whole.
    struct Piece {
        std::string key;
        std::size_t size;
    };

    platform::Result<std::string_view> encodeAll(const platform::Dictionary& annotations);
    bool encodeChanged(const platform::Dictionary& annotations);
    void replacePiece(const std::string& key, std::string_view text);

    std::string whole_;
    std::size_t headSize_ = 0;   // what is before the first piece
    std::vector<Piece> pieces_;  // in the order of their keys; none until all were encoded once
    std::set<std::string> changed_;
};

}  // namespace zorvan
