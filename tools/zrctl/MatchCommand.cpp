#include "tools/zrctl/MatchCommand.h"

#include "platform/plist/DictionaryFile.h"
#include "platform/plist/PropertyList.h"
#include "tools/zrctl/Json.h"
#include "tools/zrctl/Listing.h"
#include "tools/zrctl/Rules.h"
#include "tools/zrctl/Session.h"

using platform::Array;
using platform::Dictionary;
using platform::Result;

namespace zrctl {

namespace {

Outcome present(const Listing& listing, Format format) {
    Outcome outcome;
    outcome.status = listing.empty() ? kNothingFound : kDone;
    if (format == Format::Json) {
        outcome.output = jsonText(listing.forms());
    } else if (format == Format::PropertyList) {
        const Result<std::string> xml = platform::writeXmlPropertyList(listing.forms(), 1u << 30);
        if (!xml) return Outcome::failure(describe(xml.error()));
        outcome.output = *xml;
    } else if (listing.empty()) {
        outcome.complaint = "no plug-in found";
    } else {
        outcome.output = format == Format::Long ? listing.paragraphs() : listing.table();
    }
    return outcome;
}

}  // namespace

Outcome runMatch(const Options& options) {
    const Result<Dictionary> given = parseRules(options.rules);
    if (!given) return Outcome::usage(given.error().text);
    Dictionary rules;
    if (options.rulesFile) {
        const Result<Dictionary> file = platform::readDictionaryFile(*options.rulesFile);
        if (!file) return Outcome::failure(file.error().text);
        rules = *file;
    }
    const Result<Array> forms =
        Session(options.service).match(merged(rules, *given), options.flags);
    if (!forms) return Outcome::failure(forms.error().text);
    return present(Listing(*forms), options.format);
}

}  // namespace zrctl
