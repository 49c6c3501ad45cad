#include "tools/zrctl/PlugInNames.h"

#include <fmt/core.h>

#include "Zorvan/Keys.h"
#include "Zorvan/ZRError.h"
#include "tools/zrctl/Listing.h"

using platform::Array;
using platform::Dictionary;
using platform::Result;
using platform::Uuid;
using platform::Value;

namespace zrctl {

namespace {

std::string fact(const Dictionary& form, const char* key) {
    const Value* value = form.find(key);
    return value ? describe(*value) : std::string("-");
}

/// The plug-ins of an identifier. Rules compare digits as numbers, so they find too many.
std::vector<Dictionary> withIdentifier(const Array& forms, const std::string& identifier) {
    std::vector<Dictionary> found;
    for (const Value& form : forms) {
        const Dictionary* plugIn = form.dictionary();
        const Value* has = plugIn ? plugIn->find(zorvan::form::kIdentifier) : nullptr;
        if (has && *has == Value(identifier)) found.push_back(*plugIn);
    }
    return found;
}

Outcome ambiguous(const std::string& name, const std::vector<Dictionary>& candidates) {
    std::string text = fmt::format("{} names {} plug-ins, take a UUID:", name, candidates.size());
    const char* separator = " ";
    for (const Dictionary& form : candidates) {
        text += fmt::format("{}{} (version {}, {})", separator, fact(form, zorvan::form::kUuid),
                            fact(form, zorvan::form::kVersion), fact(form, zorvan::form::kPath));
        separator = "; ";
    }
    return Outcome::failure(std::move(text));
}

}  // namespace

Outcome noSuchPlugIn(const std::string& name) {
    return {kNothingFound, {}, "no such plug-in: " + name};
}

Result<Array> visiblePlugIns(Session& session, const Dictionary& rules) {
    constexpr std::uint64_t kEveryOne = zorvan::ZRDiscoverVersions | zorvan::ZRDiscoverDuplicates;
    Result<Array> forms = session.match(rules, kEveryOne | zorvan::ZRDiscoverAll);
    const bool refused = !forms && forms.error().domain == zorvan::kZRErrorDomain &&
                         forms.error().code == zorvan::kZRErrorDenied;
    return refused ? session.match(rules, kEveryOne) : forms;
}

std::variant<std::vector<Uuid>, Outcome> plugInsNamed(Session& session,
                                                      const std::vector<std::string>& names) {
    Array patterns;
    for (const std::string& name : names)
        if (!Uuid::parse(name)) patterns.append("=" + name);
    Array forms;
    if (!patterns.empty()) {
        const Result<Array> found =
            visiblePlugIns(session, {{zorvan::key::kExtensionIdentifier, patterns}});
        if (!found) return Outcome::failure(found.error().text);
        forms = Listing(*found).forms();
    }

    std::vector<Uuid> uuids;
    for (const std::string& name : names) {
        if (const auto uuid = Uuid::parse(name)) {
            uuids.push_back(*uuid);
            continue;
        }
        const std::vector<Dictionary> candidates = withIdentifier(forms, name);
        if (candidates.empty()) return noSuchPlugIn(name);
        if (candidates.size() > 1) return ambiguous(name, candidates);
        const auto uuid = Uuid::parse(fact(candidates[0], zorvan::form::kUuid));
        if (!uuid) return Outcome::failure("zrd's reply has a plug-in without a UUID");
        uuids.push_back(*uuid);
    }
    return uuids;
}

}  // namespace zrctl
