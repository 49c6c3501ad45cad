#include "platform/XmlPropertyListCheck.h"

#include <array>

#include "platform/PropertyList.h"

namespace platform {

namespace {

constexpr std::string_view kSpace = " \t\r\n";

/// Follows the markup as far as it decides about nesting. It must see the same containers as the
/// parser does: a comment or a quoted ">" that only one of the two honours would hide some.
class Scanner {
  public:
    explicit Scanner(std::string_view bytes) : rest_(bytes) {}

    const char* check() {
        for (;;) {
            std::size_t tag = rest_.find('<');
            if (tag == std::string_view::npos) return nullptr;
            rest_.remove_prefix(tag + 1);
            if (const char* problem = checkMarkup()) return problem;
        }
    }

  private:
    const char* checkMarkup() {
        if (rest_.starts_with("!--")) return skipPast("-->", 3);
        if (rest_.starts_with("![CDATA[")) return skipPast("]]>", 8);
        if (rest_.starts_with('!') || rest_.starts_with('?')) {
            if (inElements_) return "a declaration or instruction between its elements";
            return skipDeclaration(rest_.front() == '!' ? ">" : "?>");
        }
        return checkTag();
    }

    const char* skipPast(std::string_view end, std::size_t from) {
        std::size_t found = rest_.find(end, from);
        if (found == std::string_view::npos) return "truncated";
        rest_.remove_prefix(found + end.size());
        return nullptr;
    }

    /// To the end of a declaration or instruction; quoted text may hold that end.
    const char* skipDeclaration(std::string_view end) {
        for (std::size_t i = 0; i < rest_.size(); ++i) {
            if (rest_[i] == '"') {
                i = rest_.find('"', i + 1);
                if (i == std::string_view::npos) break;
            } else if (rest_[i] == '[' || rest_[i] == '<') {
                return "a document type with declarations";
            } else if (rest_.substr(i).starts_with(end)) {
                rest_.remove_prefix(i + end.size());
                return nullptr;
            }
        }
        return "truncated";
    }

    const char* checkTag() {
        inElements_ = true;
        bool closes = rest_.starts_with('/');
        if (closes) rest_.remove_prefix(1);
        if (!closes && objectsLeft_-- == 0) return "too many objects";
        std::string_view name = rest_.substr(0, rest_.find_first_of("/<> \t\r\n"));
        std::size_t end = endOfTag();
        if (end == std::string_view::npos) return "a malformed tag";
        bool isEmpty = end > 0 && rest_[end - 1] == '/';
        rest_.remove_prefix(end + 1);
        if (name == "key" && !closes && ++keys_[depth_] > kMaxPropertyListEntries)
            return "too many entries in a dictionary";
        if (name != "dict" && name != "array") return nullptr;
        if (closes) {
            if (depth_ > 0) --depth_;
        } else if (!isEmpty) {
            if (depth_ == kMaxPropertyListFileDepth) return "nested too deep";
            keys_[++depth_] = 0;
        }
        return nullptr;
    }

    /// Where the tag's ">" is; quoted text may hold another. None when a "<" comes first.
    std::size_t endOfTag() const {
        bool quoted = false;
        for (std::size_t i = 0; i < rest_.size(); ++i) {
            if (rest_[i] == '"') quoted = !quoted;
            if (rest_[i] == '<') break;
            if (rest_[i] == '>' && !quoted) return i;
        }
        return std::string_view::npos;
    }

    std::string_view rest_;
    std::size_t objectsLeft_ = kMaxPropertyListObjects;
    int depth_ = 0;
    std::array<std::size_t, kMaxPropertyListFileDepth + 1> keys_{};  // by depth
    bool inElements_ = false;
};

/// Whether the text ends with the end of its root element, but for spaces and comments.
bool isComplete(std::string_view bytes) {
    for (;;) {
        bytes = bytes.substr(0, bytes.find_last_not_of(kSpace) + 1);
        if (!bytes.ends_with("-->")) break;
        std::size_t comment = bytes.rfind("<!--");
        if (comment == std::string_view::npos) return false;
        bytes = bytes.substr(0, comment);
    }
    if (!bytes.ends_with('>')) return false;
    bytes.remove_suffix(1);
    bytes = bytes.substr(0, bytes.find_last_not_of(kSpace) + 1);
    return bytes.ends_with("</plist");
}

}  // namespace

const char* problemOfXmlPropertyList(std::string_view bytes) {
    std::size_t start = bytes.find_first_not_of(kSpace);
    if (start == std::string_view::npos || bytes[start] != '<') return "not a property list";
    if (bytes.find('\0') != std::string_view::npos) return "a NUL in its text";
    if (!isComplete(bytes)) return "truncated, or followed by something else";
    return Scanner(bytes).check();
}

}  // namespace platform
