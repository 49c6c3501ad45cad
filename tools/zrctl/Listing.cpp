#include "tools/zrctl/Listing.h"

#include <fmt/core.h>

#include <algorithm>
#include <tuple>

#include "Zorvan/Helpers.h"
#include "Zorvan/Keys.h"
#include "platform/system/Files.h"
#include "tools/zrctl/Json.h"
#include "tools/zrctl/Table.h"
#include "tools/zrctl/Terminal.h"

using platform::Dictionary;
using platform::Value;
namespace form = zorvan::form;

namespace zrctl {

namespace {

/// The text of a form's entry; empty when it is absent.
std::string fact(const Dictionary& plugIn, const char* key) {
    const Value* value = plugIn.find(key);
    if (!value) return {};
    if (const auto date = value->date()) return dateText(*date);
    return describe(*value);
}

const Dictionary* dictionary(const Dictionary& within, const char* key) {
    const Value* value = within.find(key);
    return value ? value->dictionary() : nullptr;
}

bool before(const Value& one, const Value& other) {
    const Dictionary& a = *one.dictionary();
    const Dictionary& b = *other.dictionary();
    const auto identifiers = fact(a, form::kIdentifier).compare(fact(b, form::kIdentifier));
    if (identifiers != 0) return identifiers < 0;
    const int versions =
        zorvan::compareVersionString(fact(a, form::kVersion), fact(b, form::kVersion));
    if (versions != 0) return versions < 0;
    return fact(a, form::kPath) < fact(b, form::kPath);
}

std::string name(const Dictionary& plugIn) {
    std::string full = fact(plugIn, form::kLocalizedName);
    return full.empty() ? fact(plugIn, form::kLocalizedShortName) : full;
}

std::string application(const Dictionary& plugIn) {
    std::string full = fact(plugIn, form::kLocalizedContainingName);
    if (!full.empty()) return full;
    return std::string(platform::lastPathComponent(fact(plugIn, form::kContainingPath)));
}

std::string election(const Dictionary& plugIn) {
    return electionName(plugIn.find(form::kAnnotations));
}

std::string modified(const Dictionary& plugIn) {
    const Value* seconds = plugIn.find(form::kLastModified);
    const auto time = seconds ? seconds->numberAsInteger() : std::nullopt;
    return time ? dateText({static_cast<double>(*time)}) : std::string();
}

void addFact(std::string& text, const std::string& label, const std::string& value) {
    if (value.empty()) return;
    text += fmt::format("  {:<18}{}\n", terminal::safe(label), terminal::safe(value));
}

void addFacts(std::string& text, const char* label, const Dictionary* facts) {
    if (!facts || facts->empty()) return;
    text += fmt::format("  {}\n", label);
    for (const auto& [key, value] : *facts)
        text += fmt::format("    {} = {}\n", terminal::safe(key), terminal::safe(describe(value)));
}

std::string paragraph(const Dictionary& plugIn) {
    std::string text = fmt::format("{} {}\n", terminal::safe(fact(plugIn, form::kIdentifier)),
                                   terminal::safe(fact(plugIn, form::kVersion)));
    const std::string original = fact(plugIn, form::kOriginalIdentifier);
    if (original != fact(plugIn, form::kIdentifier)) addFact(text, "original", original);
    addFact(text, "name", fact(plugIn, form::kLocalizedName));
    addFact(text, "short name", fact(plugIn, form::kLocalizedShortName));
    addFact(text, "uuid", fact(plugIn, form::kUuid));
    addFact(text, "election", election(plugIn));
    addFact(text, "replaces", fact(plugIn, form::kOverriding));
    addFact(text, "replaced by", fact(plugIn, form::kOverrider));
    addFact(text, "path", fact(plugIn, form::kPath));
    addFact(text, "application", fact(plugIn, form::kLocalizedContainingName));
    addFact(text, "application path", fact(plugIn, form::kContainingPath));
    addFact(text, "registered", modified(plugIn));
    addFact(text, "system volume", fact(plugIn, form::kSystemResident));
    addFact(text, "hub protocol", fact(plugIn, form::kHubProtocolVersion));
    if (const Dictionary* info = dictionary(plugIn, form::kInfo)) {
        addFact(text, "extension point", fact(*info, zorvan::key::kExtensionPoint));
        addFacts(text, "attributes", dictionary(*info, zorvan::key::kAttributes));
    }
    addFacts(text, "entitlements", dictionary(plugIn, form::kEntitlements));
    addFacts(text, "annotations", dictionary(plugIn, form::kAnnotations));
    return text;
}

}  // namespace

std::string electionName(const Value* annotations) {
    const Dictionary* annotation = annotations ? annotations->dictionary() : nullptr;
    const Value* value = annotation ? annotation->find(zorvan::annotation::kElection) : nullptr;
    // Bits 8 to 15 do not belong to the choice.
    const std::int64_t election = value ? value->numberAsInteger().value_or(0) & ~0xFF00LL : 0;
    if (election == 0) return "default";
    if (election == 1) return "use";
    if (election == 2) return "ignore";
    return fmt::format("{}", election);
}

Listing::Listing(const platform::Array& forms) {
    std::copy_if(forms.begin(), forms.end(), std::back_inserter(forms_),
                 [](const Value& element) { return element.dictionary() != nullptr; });
    std::sort(forms_.begin(), forms_.end(), before);
}

std::string Listing::table() const {
    Table table({"IDENTIFIER", "VERSION", "ELECTION", "NAME", "APPLICATION", "PATH"});
    for (const Value& value : forms_) {
        const Dictionary& plugIn = *value.dictionary();
        table.add({fact(plugIn, form::kIdentifier), fact(plugIn, form::kVersion), election(plugIn),
                   name(plugIn), application(plugIn), fact(plugIn, form::kPath)});
    }
    return table.text();
}

std::string Listing::paragraphs() const {
    std::string text;
    for (const Value& plugIn : forms_) {
        if (!text.empty()) text += '\n';
        text += paragraph(*plugIn.dictionary());
    }
    return text;
}

}  // namespace zrctl
