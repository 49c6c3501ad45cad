#include "platform/plist/XmlPropertyListCheck.h"

#include <algorithm>
#include <array>
#include <cstdint>

#include "platform/plist/PropertyListLimits.h"
#include "platform/plist/PropertyListWork.h"
#include "platform/plist/XmlPropertyListText.h"

namespace platform {

namespace {

constexpr std::string_view kSpace = " \t\r\n";

std::string_view trimmed(std::string_view text) {
    std::size_t start = text.find_first_not_of(kSpace);
    if (start == std::string_view::npos) return {};
    return text.substr(start, text.find_last_not_of(kSpace) + 1 - start);
}

/// Follows the markup. It must see the same elements as the parser does: a comment or a quoted ">"
/// that only one of the two honours would hide some.
class Scanner {
  public:
    explicit Scanner(std::string_view bytes) : rest_(bytes) {}

    PropertyListCheck check() {
        while (!found_.problem) {
            std::size_t next = rest_.find_first_not_of(kSpace);
            if (next == std::string_view::npos) {
                if (depth_ > 0 || !inElements_) found_.problem = "truncated";
                break;
            }
            found_.problem = checkMarkup(rest_.substr(next));
        }
        return std::move(found_);
    }

  private:
    /// A container whose end has not come yet.
    struct Level {
        std::string_view name;
        std::size_t valuesDue = 0;
        std::size_t firstKey = 0;
    };

    const char* checkMarkup(std::string_view markup) {
        if (!markup.starts_with('<')) return "text between its elements";
        rest_ = markup.substr(1);
        if (rest_.starts_with('/')) return checkEnd();
        if (rest_.starts_with("!--")) return skipPast("-->", 3);
        if (!rest_.starts_with('!') && !rest_.starts_with('?')) return checkStart();
        if (inElements_) return "a declaration or instruction between its elements";
        return skipDeclaration(rest_.front() == '!' ? ">" : "?>");
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

    const char* checkStart() {
        std::string_view tag;
        if (!takeTag(tag)) return "a malformed tag";
        if (objectsLeft_-- == 0) return "too many objects";
        bool isEmpty = tag.ends_with('/');
        if (isEmpty) tag.remove_suffix(1);
        std::string_view name = tag.substr(0, tag.find_first_of(kSpace));
        if (!inElements_) {
            inElements_ = true;
            return name == "plist" && !isEmpty ? open(name, 1) : "no list as its root";
        }
        Level& level = levels_[depth_];
        if (name == "key") {
            if (level.name != "dict" || level.valuesDue != 0) return "a key where a value belongs";
            level.valuesDue = 1;
        } else {
            if (level.valuesDue == 0)
                return level.name == "dict" ? "a value without a key" : "more than one root";
            --level.valuesDue;
        }
        if (name != "array" && name != "dict") return checkScalar(name, isEmpty);
        if (isEmpty) return nullptr;
        return open(name, name == "array" ? SIZE_MAX : 0);
    }

    const char* open(std::string_view name, std::size_t valuesDue) {
        if (depth_ + 1 == levels_.size()) return "nested too deep";
        levels_[++depth_] = {name, valuesDue, keys_.size()};
        return nullptr;
    }

    const char* checkEnd() {
        Level& level = levels_[depth_];
        if (depth_ == 0 || !takeEnd(level.name)) return "an end without its start";
        --depth_;
        if (level.name == "array") return nullptr;
        if (level.valuesDue != 0)
            return level.name == "dict" ? "a key without a value" : "nothing in it";
        auto keys = std::span(keys_).subspan(level.firstKey);
        const char* problem = work_.addKeys(keys);
        found_.entries += keys.size();
        keys_.resize(level.firstKey);
        return problem;
    }

    const char* checkScalar(std::string_view name, bool isEmpty) {
        std::string_view text;
        if (!isEmpty && !takeText(name, text)) return "truncated, or an element inside a scalar";
        if (name == "key") keys_.push_back(text);
        if (name == "key" || name == "string")
            return work_.addText(static_cast<std::size_t>(std::ranges::count(text, '&')),
                                 text.size());
        text = trimmed(text);
        if (name == "integer") return isXmlInteger(text) ? nullptr : "a malformed integer";
        if (name == "real") return isXmlReal(text) ? nullptr : "a malformed real";
        if (name == "data") return isXmlData(text) ? nullptr : "malformed data";
        if (name == "true" || name == "false")
            return text.empty() ? nullptr : "a boolean with text";
        if (name != "date") return "an object of an unsupported kind";
        auto date = dateOfXml(text);
        if (!date) return "a malformed date";
        found_.dates.push_back(*date);
        return nullptr;
    }

    /// The text of a scalar with the comments and literal sections in it, and its end.
    bool takeText(std::string_view name, std::string_view& text) {
        std::size_t end = 0;
        for (;;) {
            end = rest_.find('<', end);
            if (end == std::string_view::npos) return false;
            std::string_view markup = rest_.substr(end + 1);
            if (markup.starts_with('/')) break;
            std::size_t last = std::string_view::npos;
            if (markup.starts_with("!--")) last = rest_.find("-->", end + 4);
            if (markup.starts_with("![CDATA[")) last = rest_.find("]]>", end + 9);
            if (last == std::string_view::npos) return false;
            end = last + 3;
        }
        text = rest_.substr(0, end);
        rest_.remove_prefix(end + 1);
        return takeEnd(name);
    }

    /// The rest of an end tag, from its "/" on.
    bool takeEnd(std::string_view name) {
        std::string_view tag;
        if (!takeTag(tag) || !tag.substr(1).starts_with(name)) return false;
        return tag.find_first_not_of(kSpace, 1 + name.size()) == std::string_view::npos;
    }

    /// Up to the tag's ">"; quoted text may hold another. None when a "<" comes first.
    bool takeTag(std::string_view& tag) {
        bool isQuoted = false;
        for (std::size_t i = 0; i < rest_.size() && rest_[i] != '<'; ++i) {
            if (rest_[i] == '"') isQuoted = !isQuoted;
            if (rest_[i] != '>' || isQuoted) continue;
            tag = rest_.substr(0, i);
            rest_.remove_prefix(i + 1);
            return true;
        }
        return false;
    }

    std::string_view rest_;
    PropertyListCheck found_;
    PropertyListWork work_;
    std::size_t objectsLeft_ = kMaxPropertyListObjects;
    /// Outermost: the file, and the element around the list.
    std::array<Level, kMaxPropertyListFileDepth + 2> levels_{};
    std::size_t depth_ = 0;
    std::vector<std::string_view> keys_;  // of all levels
    bool inElements_ = false;
};

}  // namespace

PropertyListCheck checkXmlPropertyList(std::string_view bytes) {
    if (bytes.find('\0') != std::string_view::npos) return {"a NUL in its text", {}, 0};
    return Scanner(bytes).check();
}

}  // namespace platform
