#pragma once

#include <map>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Error.h"
#include "platform/Value.h"

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

    /// Says that the annotation under a key is another one now, or gone. Without a key: all are.
    void changed(std::string_view key) { changed_.emplace(key); }
    void allChanged() { kept_.clear(); }

    /// The text for all annotations as they are now. Errors: those of `writeXmlPropertyList`.
    platform::Result<std::string> text(const platform::Dictionary& annotations);

  private:
    using Texts = std::map<std::string, std::string, std::less<>>;

    platform::Result<std::string> encodeAll(const platform::Dictionary& annotations);
    bool encodeChanged(const platform::Dictionary& annotations);
    std::string joined() const;

    // The whole text is the head, the kept texts in the order of their keys, and the tail. Nothing
    // is kept until all have been encoded once.
    std::string head_;
    Texts kept_;
    std::string tail_;
    std::set<std::string> changed_;
};

}  // namespace zorvan
