#include "tools/zrctl/ExcludeCommand.h"

#include <algorithm>
#include <functional>

#include "Zorvan/Keys.h"
#include "platform/services/Preferences.h"
#include "platform/system/Directories.h"
#include "tools/zrctl/Rules.h"
#include "tools/zrctl/ShellWord.h"

using platform::Array;
using platform::Dictionary;
using platform::Preferences;
using platform::Result;
using platform::Value;

namespace zrctl {

namespace {

const Outcome kNoRules{kNothingFound, {}, "nothing is excluded"};

Preferences preferences() {
    return Preferences(platform::Directories::fromEnvironment());
}

/// The list in the preferences, which is empty when there is none. Null for anything else: that
/// was not made here, and is not to be overwritten.
const Array* exclusionsIn(const Dictionary& stored) {
    static const Array none;
    const Value* value = stored.find(zorvan::kExclusions);
    return value ? value->array() : &none;
}

Outcome notAList() {
    return Outcome::failure(preferences().path(zorvan::kUserPreferences) +
                            ": the exclusions are not a list");
}

std::string line(const Dictionary& rule) {
    std::string text;
    for (const std::string& argument : ruleTexts(rule))
        text.append(text.empty() ? "" : " ").append(shellWord(argument));
    return text + '\n';
}

Outcome list() {
    const Result<Dictionary> stored = preferences().read(zorvan::kUserPreferences);
    if (!stored) return Outcome::failure(stored.error().text);
    const Array* exclusions = exclusionsIn(*stored);
    if (!exclusions) return notAList();
    Outcome outcome;
    for (const Value& rule : *exclusions)
        if (rule.dictionary()) outcome.output += line(*rule.dictionary());
    return outcome.output.empty() ? kNoRules : outcome;
}

/// The place in the list of the rule that these texts make, in any order; the list's size when it
/// is not there.
std::size_t find(const Array& exclusions, std::vector<std::string> texts) {
    std::sort(texts.begin(), texts.end());
    const auto isIt = [&](const Value& rule) {
        if (!rule.dictionary()) return false;
        std::vector<std::string> own = ruleTexts(*rule.dictionary());
        std::sort(own.begin(), own.end());
        return own == texts;
    };
    const Value* found = std::find_if(exclusions.begin(), exclusions.end(), isIt);
    return static_cast<std::size_t>(found - exclusions.begin());
}

/// Edits the list; `change` answers whether it changed anything.
Outcome edit(const std::function<bool(Array&)>& change) {
    Outcome outcome;
    const auto error = preferences().edit(zorvan::kUserPreferences, [&](Dictionary& stored) {
        const Array* exclusions = exclusionsIn(stored);
        if (!exclusions) {
            outcome = notAList();
            return false;
        }
        Array changed = *exclusions;
        if (!change(changed)) return false;
        stored.set(zorvan::kExclusions, changed);
        return true;
    });
    return error ? Outcome::failure(error->text) : outcome;
}

Outcome add(const std::vector<std::string>& texts) {
    const Result<Dictionary> rule = parseRules(texts);
    if (!rule) return Outcome::usage(rule.error().text);
    return edit([&](Array& exclusions) {
        const bool isNew = find(exclusions, texts) == exclusions.size();
        if (isNew) exclusions.append(*rule);
        return isNew;
    });
}

Outcome remove(const std::vector<std::string>& texts) {
    bool found = false;
    Outcome outcome = edit([&](Array& exclusions) {
        const std::size_t place = find(exclusions, texts);
        found = place < exclusions.size();
        if (found) exclusions.remove(place);
        return found;
    });
    if (outcome.status == kDone && !found) return {kNothingFound, {}, "no such rule is excluded"};
    return outcome;
}

}  // namespace

Outcome runExclude(const Options& options) {
    if (options.command == Options::Command::ExcludeAdd) return add(options.rules);
    if (options.command == Options::Command::ExcludeRemove) return remove(options.rules);
    return list();
}

}  // namespace zrctl
