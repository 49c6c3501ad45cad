// The requests "annotate" and "bulk-annotate".

#include <unordered_map>
#include <unordered_set>
#include <utility>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "platform/lum/Limits.h"
#include "platform/values/Value.h"
#include "zrd/Transaction.h"
#include "zrd/ZRDLumClient.h"
#include "zrd/ZRDPlugIn.h"
#include "zrd/ZRDServer.h"

namespace zorvan {

using platform::Dictionary;
using platform::Value;

const Dictionary* Transaction::requestedAnnotations() {
    const Value* annotations = request_.find(message::kAnnotations);
    // What the store's file could not give back counts as no dictionary.
    if (annotations && annotations->dictionary() && platform::isPropertyList(*annotations)) {
        return annotations->dictionary();
    }
    fail(kZRErrorInvalidRequest, "invalid request format (bad annotations dictionary)");
    return nullptr;
}

bool Transaction::hasRoomFor(const Dictionary& change, const ZRDPlugIn& plugIn) {
    // The user's elections are small, and find room whatever hosts have stored.
    if (!change.contains(annotation::kExtension)) return true;
    if (server().hasRoomForAnnotation(change, plugIn)) return true;
    EVLOG_INFO(ops(), "client {} plug-in {}({}) annotation refused: the annotations are too large",
               client_->pid(), plugIn.identifier(), pub(plugIn.uuid()));
    fail(kZRErrorDenied, "no room for more annotations");
    return false;
}

bool Transaction::hasShareFor(const Dictionary& change, const ZRDPlugIn& plugIn) {
    if (!change.contains(annotation::kExtension)) return true;
    if (server().hasShareForAnnotation(change, plugIn, origin())) return true;
    EVLOG_INFO(ops(),
               "client {} plug-in {}({}) annotation refused: it and those it belongs with "
               "have stored too much",
               client_->pid(), plugIn.identifier(), pub(plugIn.uuid()));
    fail(kZRErrorDenied, "too many annotations");
    return false;
}

void Transaction::annotate(const Dictionary& change, const ZRDPlugIn& plugIn) {
    hasUnsyncedAnnotations_ = true;
    server().setAnnotation(change, plugIn, origin(), platform::Sync::No);
}

void Transaction::syncAnnotations() {
    if (std::exchange(hasUnsyncedAnnotations_, false)) server().syncAnnotations();
}

void Transaction::annotatePlugIns() {
    const Dictionary* annotations = requestedAnnotations();
    if (!annotations) return;
    Dictionary change;
    const Value* election = annotations->find(annotation::kElection);
    if (election) {
        if (!election->isNumber()) {
            return fail(kZRErrorInvalidRequest, "invalid request format (annotation election)");
        }
        change.set(annotation::kElection, *election);
    }
    if (const Value* extension = annotations->find(annotation::kExtension)) {
        if (!extension->dictionary()) {
            return fail(kZRErrorInvalidRequest, "invalid request format (annotation extension)");
        }
        change.set(annotation::kExtension, *extension);
    }
    if (change.empty()) return done();

    // A plug-in named again has the change already.
    std::unordered_set<platform::Uuid> changed;
    bool completed = processUuidList([&](const std::shared_ptr<ZRDPlugIn>& plugIn) {
        if (!changed.insert(plugIn->uuid()).second) return Walk::Continue;
        if (!hasShareFor(change, *plugIn)) return Walk::Stop;
        if (!hasRoomFor(change, *plugIn)) return Walk::Stop;
        EVLOG_DEBUG(ops(), "client {} plug-in {}({}) annotation change: {}", client_->pid(),
                    plugIn->identifier(), pub(plugIn->uuid()), change);
        if (election) {
            EVLOG_INFO(ops(), "client {} plug-in {}({}) election := {}", client_->pid(),
                       plugIn->identifier(), pub(plugIn->uuid()), *election);
        }
        annotate(change, *plugIn);
        return Walk::Continue;
    });
    if (!completed) return;
    syncAnnotations();
    server().notifyAnnotationChange();
    done();
}

void Transaction::bulkAnnotatePlugIns() {
    const Dictionary* annotations = requestedAnnotations();
    if (!annotations) return;
    EVLOG_DEBUG(ops(), "bulk change requested for {} plug-ins", annotations->size());
    if (annotations->size() > platform::lum::kMaxListed)
        return fail(kZRErrorInvalidRequest, "invalid request format (bad annotations dictionary)");
    // A UUID can be spelt in many ways: of the entries for one plug-in only the last is applied,
    // which would replace what those before it had set.
    std::unordered_map<platform::Uuid, const Value*> lastOf;
    for (const auto& [key, value] : *annotations) {
        if (auto uuid = platform::Uuid::parse(key)) lastOf[*uuid] = &value;
    }
    for (const auto& [key, value] : *annotations) {
        if (!value.dictionary()) {
            return fail(kZRErrorAnnotation, "annotations values must be dictionaries");
        }
        auto uuid = platform::Uuid::parse(key);
        if (!uuid) return fail(kZRErrorAnnotation, "invalid plug-in UUID value");
        auto plugIn = server().findPlugIn(*uuid);
        if (!plugIn) return fail(kZRErrorRegistration, "no plug-in with the requested uuid");
        if (lastOf[*uuid] != &value) continue;
        const Dictionary change{{annotation::kExtension, value}};
        if (!hasShareFor(change, *plugIn)) return;
        if (!hasRoomFor(change, *plugIn)) return;
        EVLOG_DEBUG(ops(), "client {} bulk plug-in {}({}) annotation change: {}", client_->pid(),
                    plugIn->identifier(), pub(plugIn->uuid()), value);
        annotate(change, *plugIn);
    }
    syncAnnotations();
    server().notifyAnnotationChange();
    done();
}

}  // namespace zorvan
