#include "Zorvan/Helpers.h"

namespace zorvan {

platform::Dictionary dictionaryChanging(const platform::Dictionary& dictionary,
                                        std::string_view key,
                                        std::optional<platform::Value> value) {
    platform::Dictionary changed = dictionary;
    if (value) {
        changed.set(key, *std::move(value));
    } else {
        changed.remove(key);
    }
    return changed;
}

}  // namespace zorvan
