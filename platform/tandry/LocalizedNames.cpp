#include "platform/tandry/LocalizedNames.h"

#include <algorithm>
#include <cstdlib>
#include <string_view>

namespace platform::tandry {

namespace {

std::string_view environment(const char* name) {
    const char* value = std::getenv(name);
    return value ? value : "";
}

void addLanguage(std::string_view locale, std::vector<std::string>& languages) {
    auto add = [&languages](std::string_view language) {
        if (!language.empty() && std::ranges::find(languages, language) == languages.end())
            languages.emplace_back(language);
    };
    locale = locale.substr(0, locale.find_first_of(".@"));
    add(locale);
    add(locale.substr(0, locale.find('_')));
}

const platform::Text* stringAt(const Dictionary& dictionary, std::string_view key) {
    const Value* value = dictionary.find(key);
    return value ? value->string() : nullptr;
}

}  // namespace

std::vector<std::string> userLanguages() {
    std::string_view locale;
    for (const char* name : {"LC_ALL", "LC_MESSAGES", "LANG"})
        if (locale.empty()) locale = environment(name);
    std::string_view plain = locale.substr(0, locale.find('.'));
    if (plain.empty() || plain == "C" || plain == "POSIX") return {};

    std::vector<std::string> languages;
    std::string_view list = environment("LANGUAGE");
    while (!list.empty()) {
        std::size_t end = std::min(list.find(':'), list.size());
        addLanguage(list.substr(0, end), languages);
        list.remove_prefix(std::min(end + 1, list.size()));
    }
    addLanguage(locale, languages);
    return languages;
}

LocalizedNames localizedNames(const Dictionary& infoPlist, const Dictionary& localized,
                              const std::vector<std::string>& languages) {
    auto text = [&](std::string_view key) -> std::optional<std::string> {
        for (const std::string& language : languages) {
            const Value* names = localized.find(language);
            const Dictionary* dictionary = names ? names->dictionary() : nullptr;
            const auto* name = dictionary ? stringAt(*dictionary, key) : nullptr;
            if (name) return name->string();
        }
        const auto* name = stringAt(infoPlist, key);
        return name ? std::optional(name->string()) : std::nullopt;
    };
    LocalizedNames names{text("QFBundleDisplayName"), text("QFBundleName")};
    if (!names.display) names.display = names.brief;
    return names;
}

}  // namespace platform::tandry
