#include "tools/zrctl/AnnotationCommands.h"

#include <algorithm>

#include "Zorvan/Keys.h"
#include "Zorvan/ZRError.h"
#include "platform/Utf8.h"
#include "tools/zrctl/PlugInNames.h"
#include "tools/zrctl/Rules.h"
#include "tools/zrctl/Session.h"

using platform::Array;
using platform::Dictionary;
using platform::Error;
using platform::Result;
using platform::Uuid;
using platform::Value;

namespace zrctl {

namespace {

std::string joined(const std::vector<Uuid>& uuids) {
    std::string text;
    for (const Uuid& uuid : uuids) text += (text.empty() ? "" : ", ") + uuid.string();
    return text;
}

/// The daemon does not say which UUID it does not know; those before it have been changed.
Outcome outcomeOf(const Error& error, const std::vector<Uuid>& uuids) {
    const bool unknown = error.domain == zorvan::kZRErrorDomain &&
                         error.code == zorvan::kZRErrorInvalidRequest &&
                         error.text.starts_with("no such plugin");
    if (!unknown) return Outcome::failure(error.text);
    if (uuids.size() == 1) return noSuchPlugIn(joined(uuids));
    return noSuchPlugIn("one of " + joined(uuids) + " (those before it are changed)");
}

Outcome change(Session& session, const std::vector<Uuid>& uuids, const Dictionary& annotations) {
    const auto reply = session.ask([&](auto& client, const auto& callback) {
        client.setPluginAnnotations(uuids, annotations, callback);
    });
    return reply ? Outcome{} : outcomeOf(reply.error(), uuids);
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
    Array patterns;
    for (const Uuid& uuid : uuids) patterns.append("=" + uuid.string());
    const Result<Array> forms = visiblePlugIns(session, {{zorvan::rule::kUuid, patterns}});
    if (!forms) return Outcome::failure(forms.error().text);
    Dictionary extensions;
    for (const Value& form : *forms) {
        const Value* uuid =
            form.dictionary() ? form.dictionary()->find(zorvan::form::kUuid) : nullptr;
        if (uuid && uuid->string())
            extensions.set(*uuid->string(), merged(extensionOf(*form.dictionary()), pairs));
    }
    for (const Uuid& uuid : uuids) {
        if (!extensions.contains(uuid.string()))
            return noSuchPlugIn(uuid.string() + " (or it is excluded, then use --replace)");
    }
    const auto reply = session.ask([&](auto& client, const auto& callback) {
        client.bulkSetPluginAnnotations(extensions, callback);
    });
    return reply ? Outcome{} : Outcome::failure(reply.error().text);
}

/// Calls `work` with a session and the plug-ins that names stand for.
template <class Work>
Outcome withPlugIns(const std::string& service, const std::vector<std::string>& names, Work work) {
    for (const std::string& name : names)
        if (!platform::isValidUtf8(name)) return Outcome::usage(name + ": not UTF-8 text");
    Session session(service);
    const auto uuids = plugInsNamed(session, names);
    if (const auto* outcome = std::get_if<Outcome>(&uuids)) return *outcome;
    return work(session, std::get<std::vector<Uuid>>(uuids));
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
