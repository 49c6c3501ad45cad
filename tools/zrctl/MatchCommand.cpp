#include "tools/zrctl/MatchCommand.h"

#include <fmt/core.h>

#include "Zorvan/Keys.h"
#include "platform/PropertyList.h"
#include "tools/zrctl/Json.h"
#include "tools/zrctl/Listing.h"
#include "tools/zrctl/Rules.h"
#include "tools/zrctl/Session.h"

using platform::Dictionary;
using platform::Error;
using platform::Message;
using platform::Result;
using platform::Value;

namespace zrctl {

namespace {

Result<Listing> ask(const std::string& service, const Dictionary& rules, std::uint64_t flags) {
    Session session(service);
    const Result<Message> reply = session.ask(
        [&](auto& client, const auto& callback) { client.matchPlugIns(rules, flags, callback); });
    if (!reply) return reply.error();
    const Value* packed = reply->find(zorvan::message::kMatches);
    const std::optional<Value> forms = packed ? session.unpack(*packed) : std::nullopt;
    if (!forms || !forms->array()) return Error{"zrctl", 0, "zrd's reply has no list of matches"};
    return Listing(*forms->array());
}

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
        const Result<Dictionary> file = readRulesFile(*options.rulesFile);
        if (!file) return Outcome::failure(file.error().text);
        rules = *file;
    }
    const Result<Listing> listing = ask(options.service, mergeRules(rules, *given), options.flags);
    if (!listing) return Outcome::failure(listing.error().text);
    return present(*listing, options.format);
}

}  // namespace zrctl
