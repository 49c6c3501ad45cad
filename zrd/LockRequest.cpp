// The request "lock": takes plug-ins out of service, and gives them back.

#include <fmt/format.h>

#include <algorithm>
#include <vector>

#include "Zorvan/Keys.h"
#include "Zorvan/LogHandles.h"
#include "zrd/Transaction.h"
#include "zrd/ZRDLumClient.h"
#include "zrd/ZRDPlugIn.h"
#include "zrd/ZRDServer.h"

namespace zorvan {

using platform::Array;
using platform::Value;

namespace {

/// Plug-ins for a log line.
std::string describePlugIns(const ZRDPlugInList& plugIns) {
    std::string text = "(";
    for (const auto& plugIn : plugIns) {
        if (text.size() > 1) text += ", ";
        text += fmt::format("{} {}", plugIn->uuid().string(), plugIn->identifier());
    }
    return text + ")";
}

}  // namespace

void Transaction::lockDownPlugIns() {
    const Value* tokens = request_.find(message::kUuids);
    if (tokens && tokens->array()) return releaseHolds(*tokens->array());
    HoldSubject subject;
    if (!collectPlugInsToHold(subject)) return;
    if (unsignedUnder(message::kFlags) != ZRHoldPlugIns && !areIdle(subject.plugIns)) return;
    takeHold(std::move(subject));
}

void Transaction::releaseHolds(const Array& tokens) {
    for (const Value& element : tokens) {
        // What is no token releases nothing: this never fails.
        if (auto token = element.uuid()) server().unholdToken(*token);
    }
    done();
}

bool Transaction::collectPlugInsToHold(HoldSubject& subject) {
    const std::uint64_t flags = unsignedUnder(message::kFlags);
    // A path named again adds nothing: what is collected does not grow with the request's repeats.
    ZRDPlugInHold::PlugIns known;
    const auto add = [&](const std::shared_ptr<ZRDPlugIn>& plugIn) {
        if (known.insert(plugIn).second) subject.plugIns.push_back(plugIn);
    };
    return marshalPaths([&](const NamedPath& named) {
        const std::string& path = named.path;
        if (!named.resolved) {
            fail(kZRErrorPath, fmt::format("invalid path: {}", path));
            return Walk::Stop;
        }
        if (flags == ZRHoldPlugIns) {
            auto plugIn = server().findPlugInAtPath(path);
            if (!plugIn) {
                fail(kZRErrorPath, fmt::format("no plug-in at path:{}", path));
                return Walk::Stop;
            }
            add(plugIn);
        } else if (flags == ZRHoldApplications) {
            if (!subject.applications.insert(path).second) return Walk::Continue;
            const auto inside = server().plugInsWithinApplication(path);
            if (inside) std::ranges::for_each(*inside, add);
        } else {
            fail(kZRErrorInvalidRequest, "invalid request format (unsupported hold flags)");
            return Walk::Stop;
        }
        return Walk::Continue;
    });
}

bool Transaction::areIdle(const ZRDPlugInList& plugIns) {
    ZRDPlugInList busy;
    Array conflicts;
    for (const auto& plugIn : plugIns) {
        if (auto conflict = plugIn->checkBusy()) {
            busy.push_back(plugIn);
            conflicts.append(*std::move(conflict));
        }
    }
    if (busy.empty()) return true;
    EVLOG_DEBUG(ops(), "hold rejected. Busy plug-ins:{}", describePlugIns(busy));
    reply_.set(message::kConflicts, std::move(conflicts));
    fail(kZRErrorBusy, "plug-ins are busy");
    return false;
}

void Transaction::takeHold(HoldSubject subject) {
    // What a hold costs is the daemon's, and so is each place, which need not hold anything.
    auto share =
        server().holdPool().draw(origin(), std::max<std::size_t>(subject.applications.size(), 1));
    if (!share) return fail(kZRErrorDenied, "too many holds");
    auto hold = std::make_shared<ZRDPlugInHold>(std::move(subject), client_, *std::move(share),
                                                *server().services().launcher);
    server().addHold(hold);
    // The client may have died meanwhile, and its holds been looked for before this one was there.
    if (!client_->acceptWork()) server().unholdClient(*client_);
    reply_.set(message::kUuids, hold->uuid());
    EVLOG_DEBUG(ops(), "hold request granted uuid:{}", pub(hold->uuid()));
    done();
}

}  // namespace zorvan
