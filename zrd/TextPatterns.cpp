#include "zrd/TextPatterns.h"

#include <algorithm>
#include <utility>

#include "Zorvan/Helpers.h"
#include "platform/services/Types.h"

namespace zorvan {

namespace {

constexpr std::string_view kConformsOperator = "?UT-CONFORMS:";
constexpr std::string_view kIsOperator = "?UT-IS:";

/// Tested in this order, so that the longer ones come first; the empty one takes every other
/// pattern.
constexpr std::string_view kOperators[] = {"<>", "<=", ">=", "=", "<", ">", ""};

/// So many texts are compared faster one by one than looked up.
constexpr std::size_t kFew = 4;

/// Keeps the greater (`sign` 1) or the smaller (-1) of two texts.
void widen(std::optional<std::string>& bound, std::string operand, int sign) {
    if (!bound || compareVersionString(operand, *bound) == sign) bound = std::move(operand);
}

}  // namespace

bool TextPatterns::add(const std::string& pattern) {
    if (!pattern.starts_with('?')) {
        const std::string_view* prefix = std::ranges::find_if(
            kOperators, [&](std::string_view candidate) { return pattern.starts_with(candidate); });
        addComparison(*prefix, pattern.substr(prefix->size()));
    } else if (pattern.starts_with(kConformsOperator)) {
        ancestors_.insert(types_->name(pattern.substr(kConformsOperator.size())));
    } else if (pattern.starts_with(kIsOperator)) {
        for (std::string& name : types_->lineage(pattern.substr(kIsOperator.size())))
            descendants_.insert(std::move(name));
    } else {
        return false;
    }
    return true;
}

void TextPatterns::addComparison(std::string_view prefix, std::string operand) {
    if (prefix.empty() || prefix == "=") {
        auto form = canonicalVersionString(operand);
        longestForm_ = std::max(longestForm_, form->size());
        if (equalForms_.insert(*std::move(form)).second) equal_.push_back(std::move(operand));
    } else if (prefix == "<") {
        widen(below_, std::move(operand), 1);
    } else if (prefix == "<=") {
        widen(atMost_, std::move(operand), 1);
    } else if (prefix == ">") {
        widen(above_, std::move(operand), -1);
    } else if (prefix == ">=") {
        widen(atLeast_, std::move(operand), -1);
    } else if (!other_) {
        other_ = std::move(operand);
    } else if (compareVersionString(*other_, operand) != 0) {
        takesAny_ = true;
    }
}

bool TextPatterns::matches(std::string_view text) const {
    return takesAny_ || isEqual(text) || isOrdered(text) || hasType(text);
}

bool TextPatterns::isEqual(std::string_view text) const {
    if (equal_.size() <= kFew)
        return std::ranges::any_of(equal_, [&](const std::string& operand) {
            return text == operand || compareVersionString(text, operand) == 0;
        });
    const auto form = canonicalVersionString(text, longestForm_);
    return form && equalForms_.contains(*form);
}

bool TextPatterns::isOrdered(std::string_view text) const {
    return (below_ && compareVersionString(text, *below_) < 0) ||
           (atMost_ && compareVersionString(text, *atMost_) <= 0) ||
           (above_ && compareVersionString(text, *above_) > 0) ||
           (atLeast_ && compareVersionString(text, *atLeast_) >= 0) ||
           (other_ && compareVersionString(text, *other_) != 0);
}

bool TextPatterns::hasType(std::string_view text) const {
    if (!descendants_.empty() && descendants_.contains(types_->name(std::string(text))))
        return true;
    if (ancestors_.empty()) return false;
    return std::ranges::any_of(types_->lineage(std::string(text)), [this](const std::string& name) {
        return ancestors_.contains(name);
    });
}

}  // namespace zorvan
