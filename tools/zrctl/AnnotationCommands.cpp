#include "tools/zrctl/AnnotationCommands.h"

#include "Zorvan/Keys.h"
#include "tools/zrctl/PlugInNames.h"
#include "tools/zrctl/Rules.h"

using platform::Dictionary;
using platform::Result;
using platform::Uuid;
using platform::Value;

namespace zrctl {

namespace {

Outcome change(Session& session, const std::vector<Uuid>& uuids, const Dictionary& annotations) {
    const auto reply = session.ask([&](auto& client, const auto& callback) {
        client.setPluginAnnotations(uuids, annotations, callback);
    });
    return reply ? Outcome{} : failureWith(uuids, reply.error(), " (those before it are changed)");
}

/// What a form has as its plug-in's extension.
Dictionary extensionOf(const Dictionary& form) {
    const Value* value = form.find(zorvan::form::kAnnotations);
    const Dictionary* annotations = value ? value->dictionary() : nullptr;
    value = annotations ? annotations->find(zorvan::annotation::kExtension) : nullptr;
    const Dictionary* extension = value ? value->dictionary() : nullptr;
    return extension ? *extension : Dictionary();
}

/// Gives each plug-in what its extension is now and `pairs`, which win.
Outcome merge(Session& session, const std::vector<Uuid>& uuids, const Dictionary& pairs) {
    const auto forms = formsOf(session, uuids);
    if (const auto* outcome = std::get_if<Outcome>(&forms)) return *outcome;
    Dictionary extensions;
    for (std::size_t i = 0; i < uuids.size(); ++i)
        extensions.set(uuids[i].string(),
                       merged(extensionOf(std::get<std::vector<Dictionary>>(forms)[i]), pairs));
    const auto reply = session.ask([&](auto& client, const auto& callback) {
        client.bulkSetPluginAnnotations(extensions, callback);
    });
    return reply ? Outcome{} : Outcome::failure(reply.error().text);
}

}  // namespace

Outcome runElect(const Options& options) {
    const Dictionary annotations{{zorvan::annotation::kElection, options.election}};
    return withPlugIns(options.service, options.plugIns,
                       [&](Session& session, const std::vector<Uuid>& uuids) {
                           return change(session, uuids, annotations);
                       });
}

Outcome runAnnotate(const Options& options) {
    std::vector<std::string> names, texts;
    for (const std::string& argument : options.plugIns)
        (argument.find('=') == std::string::npos ? names : texts).push_back(argument);
    if (names.empty()) return Outcome::usage("no plug-in is named");
    if (texts.empty() && !options.replace) return Outcome::usage("there is no KEY=VALUE");
    const Result<Dictionary> pairs = parsePairs(texts);
    if (!pairs) return Outcome::usage(pairs.error().text);
    return withPlugIns(
        options.service, names, [&](Session& session, const std::vector<Uuid>& uuids) {
            if (!options.replace) return merge(session, uuids, *pairs);
            return change(session, uuids, {{zorvan::annotation::kExtension, *pairs}});
        });
}

}  // namespace zrctl
