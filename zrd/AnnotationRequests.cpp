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

void Transaction::annotate(const Dictionary& change, const ZRDPlugIn& plugIn,
                           std::function<void()> then) {
    hasUnsyncedAnnotations_ = true;
    server().setAnnotation(change, plugIn, origin(), platform::Sync::Later);
    onServiceQueue(std::move(then))();
}

void Transaction::syncAnnotations() {
    if (std::exchange(hasUnsyncedAnnotations_, false)) server().syncAnnotations();
}

void Transaction::finishAnnotating() {
    syncAnnotations();
    server().notifyAnnotationChange();
    done();
}

/// One change for several plug-ins, and how far it has come.
struct Transaction::Annotating {
    Dictionary change;
    std::unordered_set<platform::Uuid> changed{};
    std::size_t next = 0;  // in "uuids"
};

void Transaction::annotatePlugIns() {
    const Dictionary* annotations = requestedAnnotations();
    if (!annotations) return;
    Dictionary change;
    if (const Value* election = annotations->find(annotation::kElection)) {
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
    annotateNext(std::make_shared<Annotating>(Annotating{.change = std::move(change)}));
}

void Transaction::annotateNext(const std::shared_ptr<Annotating>& annotating) {
    const Dictionary& change = annotating->change;
    const bool completed = processUuidList(
        [&](const std::shared_ptr<ZRDPlugIn>& plugIn) {
            ++annotating->next;
            const bool isFirst = annotating->changed.insert(plugIn->uuid()).second;
            if (isFirst && (!hasShareFor(change, *plugIn) || !hasRoomFor(change, *plugIn)))
                return Walk::Stop;
            EVLOG_DEBUG(ops(), "client {} plug-in {}({}) annotation change: {}", client_->pid(),
                        plugIn->identifier(), pub(plugIn->uuid()), change);
            if (const Value* election = change.find(annotation::kElection)) {
                EVLOG_INFO(ops(), "client {} plug-in {}({}) election := {}", client_->pid(),
                           plugIn->identifier(), pub(plugIn->uuid()), *election);
            }
            // A plug-in named again has the change already.
            if (!isFirst) return Walk::Continue;
            annotate(change, *plugIn, [=, this] { annotateNext(annotating); });
            return Walk::Stop;
        },
        annotating->next);
    if (completed) finishAnnotating();
}

/// Changes of several plug-ins, and how far they have come.
struct Transaction::BulkAnnotating {
    const Dictionary& annotations;  // of the request
    // A UUID can be spelt in many ways: of the entries for one plug-in only the last is applied,
    // which would replace what those before it had set.
    std::unordered_map<platform::Uuid, const Value*> lastOf{};
    const Dictionary::Entry* next = annotations.begin();
};

void Transaction::bulkAnnotatePlugIns() {
    const Dictionary* annotations = requestedAnnotations();
    if (!annotations) return;
    EVLOG_DEBUG(ops(), "bulk change requested for {} plug-ins", annotations->size());
    if (annotations->size() > platform::lum::kMaxListed)
        return fail(kZRErrorInvalidRequest, "invalid request format (bad annotations dictionary)");
    const auto annotating = std::make_shared<BulkAnnotating>(BulkAnnotating{*annotations});
    for (const auto& [key, value] : *annotations) {
        if (auto uuid = platform::Uuid::parse(key)) annotating->lastOf[*uuid] = &value;
    }
    bulkAnnotateNext(annotating);
}

void Transaction::bulkAnnotateNext(const std::shared_ptr<BulkAnnotating>& annotating) {
    while (annotating->next != annotating->annotations.end()) {
        const auto& [key, value] = *annotating->next++;
        if (!value.dictionary()) {
            return fail(kZRErrorAnnotation, "annotations values must be dictionaries");
        }
        auto uuid = platform::Uuid::parse(key);
        if (!uuid) return fail(kZRErrorAnnotation, "invalid plug-in UUID value");
        auto plugIn = server().findPlugIn(*uuid);
        if (!plugIn) return fail(kZRErrorRegistration, "no plug-in with the requested uuid");
        const bool isLast = annotating->lastOf[*uuid] == &value;
        const Dictionary change{{annotation::kExtension, value}};
        if (isLast && (!hasShareFor(change, *plugIn) || !hasRoomFor(change, *plugIn))) return;
        EVLOG_DEBUG(ops(), "client {} bulk plug-in {}({}) annotation change: {}", client_->pid(),
                    plugIn->identifier(), pub(plugIn->uuid()), value);
        if (!isLast) continue;
        return annotate(change, *plugIn, [=, this] { bulkAnnotateNext(annotating); });
    }
    finishAnnotating();
}

}  // namespace zorvan
