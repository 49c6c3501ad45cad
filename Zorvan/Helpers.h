#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/values/Value.h"
#include "platform/values/VersionText.h"

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

using platform::canonicalVersionString;
using platform::compareVersionString;

}  // namespace zorvan
