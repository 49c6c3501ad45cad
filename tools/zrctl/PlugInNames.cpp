#include "tools/zrctl/PlugInNames.h"

#include <fmt/core.h>

#include <map>

#include "Zorvan/Helpers.h"
#include "Zorvan/Keys.h"
#include "Zorvan/ZRError.h"
#include "platform/values/Utf8.h"
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

Outcome failureWith(const std::vector<Uuid>& uuids, const platform::Error& error,
                    const char* remark) {
    const bool unknown = error.domain == zorvan::kZRErrorDomain &&
                         error.code == zorvan::kZRErrorInvalidRequest &&
                         error.text.starts_with("no such plugin");
    if (!unknown) return Outcome::failure(error.text);
    std::string names;
    for (const Uuid& uuid : uuids) names.append(names.empty() ? "" : ", ").append(uuid.string());
    return noSuchPlugIn(uuids.size() == 1 ? names : "one of " + names + remark);
}

Outcome withPlugIns(const std::string& service, const std::vector<std::string>& names,
                    const std::function<Outcome(Session&, const std::vector<Uuid>&)>& work) {
    for (const std::string& name : names)
        if (!platform::isValidUtf8(name)) return Outcome::usage(name + ": not UTF-8 text");
    Session session(service);
    const auto uuids = plugInsNamed(session, names);
    if (const auto* outcome = std::get_if<Outcome>(&uuids)) return *outcome;
    return work(session, std::get<std::vector<Uuid>>(uuids));
}

std::variant<std::vector<Dictionary>, Outcome> formsOf(Session& session,
                                                       const std::vector<Uuid>& uuids) {
    const Array patterns = zorvan::arrayWithValues(uuids, [](const Uuid& uuid) {
        return std::optional<Value>(fmt::format("={}", uuid.string()));
    });
    const Result<Array> forms = visiblePlugIns(session, {{zorvan::rule::kUuid, patterns}});
    if (!forms) return Outcome::failure(forms.error().text);
    std::map<std::string, Dictionary> known;
    for (const Value& form : *forms)
        if (form.dictionary())
            known.emplace(fact(*form.dictionary(), zorvan::form::kUuid), *form.dictionary());
    std::vector<Dictionary> found;
    for (const Uuid& uuid : uuids) {
        const auto form = known.find(uuid.string());
        if (form == known.end()) return noSuchPlugIn(uuid.string() + " (or it is excluded)");
        found.push_back(form->second);
    }
    return found;
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
    const Array patterns =
        zorvan::arrayWithValues(names, [](const std::string& name) -> std::optional<Value> {
            if (Uuid::parse(name)) return std::nullopt;
            return fmt::format("={}", name);
        });
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
