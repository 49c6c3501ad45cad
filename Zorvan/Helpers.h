#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/values/Value.h"

namespace zorvan {

/// A new array of what `transform` answers for each element, in order, without the absent answers.
/// `transform` takes an element and answers std::optional<platform::Value>.
template <class Collection, class Transform>
platform::Array arrayWithValues(const Collection& collection, Transform&& transform) {
    std::vector<platform::Value> values;
    for (const auto& element : collection) {
        if (std::optional<platform::Value> value = transform(element))
            values.push_back(*std::move(value));
    }
    return platform::Array(std::move(values));
}

/// A copy of `dictionary` with `value` under `key`, or without that key when there is no value.
platform::Dictionary dictionaryChanging(const platform::Dictionary& dictionary,
                                        std::string_view key, std::optional<platform::Value> value);

/// Compares two version texts, `receiver` with `other`: -1 ascending, 0 same, +1 descending. Runs
/// of the digits 0 to 9 compare by their numeric value, however long and with or without leading
/// zeros; every other byte compares by value, case-sensitively; the first difference decides, and a
/// text that ends first comes first.
int compareVersionString(std::string_view receiver, std::string_view other);

/// The form that all version texts which compare as the same have in common, and no others: without
/// leading zeros. None when it has more than `limit` bytes.
std::optional<std::string> canonicalVersionString(std::string_view text,
                                                  std::size_t limit = std::string::npos);

}  // namespace zorvan
