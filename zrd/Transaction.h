#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Zorvan/ZRError.h"
#include "platform/lum/Message.h"
#include "platform/lum/Origin.h"
#include "platform/lum/PlaceLooks.h"
#include "zrd/HostRestriction.h"
#include "zrd/ZRDPlugIn.h"

namespace zorvan {

class MatchResult;
class RequestPaths;
class ZRDLumClient;
class ZRDPlugIn;
class ZRDServer;
struct HoldSubject;
struct ZRDPlugInDraft;

/// One request being served: the message, the reply being built for it, and who sent it. Made when
/// the message arrives; everything else runs on the service queue, one transaction at a time (but
/// others are served while one waits for the registry). Every request gets exactly one reply:
/// `done`, or one of the two `fail`, directly or through a walker that failed.
class Transaction : public std::enable_shared_from_this<Transaction> {
  public:
    Transaction(platform::Message request, std::shared_ptr<ZRDLumClient> client);

    /// What has to be resolved before `dispatch`; null when the request reads no paths.
    const std::shared_ptr<RequestPaths>& paths() const { return paths_; }

    /// Serves the request: checks its version and its client, then runs the handler of its type.
    void dispatch();

    const std::shared_ptr<ZRDLumClient>& client() const { return client_; }
    const platform::Message& request() const { return request_; }
    std::uint64_t version() const { return version_; }

  private:
    /// Whether a walk goes on. A callback that answers `Stop` has sent the reply.
    enum class Walk { Continue, Stop };

    // Handlers, one a request type.
    void addPlugIns();
    void removePlugIns();
    void bulkPlugIns();
    void matchPlugIns();
    void readyPlugIns();
    void accessPlugIns();
    void annotatePlugIns();
    void bulkAnnotatePlugIns();
    void lockDownPlugIns();

    struct Matching;
    void accept(const std::shared_ptr<ZRDPlugIn>& plugIn, ZRDPlugInDraft& draft,
                Matching& matching);
    void completeForms(const std::shared_ptr<Matching>& matching, std::size_t first);
    void completeLateForms(const std::shared_ptr<Matching>& matching);
    void answerMatch(MatchResult& result);

    /// Has looks at bundles made, which their file systems may hold up, and goes on with which of
    /// them are done: on the service queue, and at once when there are none. A look that hangs goes
    /// on for as long, so it must not hold this object.
    void lookAtBundles(std::vector<platform::PlaceLooks::Look> looks,
                       std::function<void(const std::vector<bool>& done)> then);

    /// What goes on with the request on the service queue when it is called, once, by any thread.
    std::function<void()> onServiceQueue(std::function<void()> then);

    /// Read when it is first asked for.
    const HostRestriction& hostRestriction();
    /// Whether the host may have a plug-in made ready; otherwise the failure has been sent.
    bool admitToReady(const ZRDPlugIn& plugIn);
    /// Goes on with "access" from the plug-in of that place on, with the tokens of those before.
    void accessFrom(std::size_t first, platform::Array tokens);
    void failToAccess(const ZRDPlugIn& plugIn, int code);
    /// Plug-ins that are to be enabled, and how far they are prepared: one after another.
    struct Enabling {
        std::vector<std::shared_ptr<ZRDPlugIn>> plugIns;
        std::vector<ZRDPlugIn::Preparation> prepared{};
    };
    void prepareNext(const std::shared_ptr<Enabling>& enabling);
    /// Enables all of them, or, when one may not be by now, none.
    void enable(const Enabling& enabling);
    void releaseHolds(const platform::Array& tokens);
    /// What "paths" names; false when the failure has been sent.
    bool collectPlugInsToHold(HoldSubject& subject);
    /// Whether none of them is busy; otherwise the failure has been sent, with the conflicts.
    bool areIdle(const std::vector<std::shared_ptr<ZRDPlugIn>>& plugIns);
    void takeHold(HoldSubject subject);

    // Annotations are changed one after another, and other requests are served in between: the file
    // is replaced for each. The request goes on to its end, whether or not its client waits.
    struct Annotating;
    struct BulkAnnotating;
    void annotateNext(const std::shared_ptr<Annotating>& annotating);
    void bulkAnnotateNext(const std::shared_ptr<BulkAnnotating>& annotating);
    /// Changes the plug-in's annotation for this client, saves it, to be synced later, and goes on
    /// when others have had their turn.
    void annotate(const platform::Dictionary& change, const ZRDPlugIn& plugIn,
                  std::function<void()> then);
    /// What this request has changed is on the disk afterwards: before anybody is told of it.
    void syncAnnotations();
    void finishAnnotating();
    /// The request's "annotations"; null when they cannot be stored, and the failure has been sent.
    const platform::Dictionary* requestedAnnotations();
    /// Whether the store has room for a change; otherwise the failure has been sent.
    bool hasRoomFor(const platform::Dictionary& change, const ZRDPlugIn& plugIn);
    /// Whether this client's origin may store a change, too; otherwise the failure has been sent.
    bool hasShareFor(const platform::Dictionary& change, const ZRDPlugIn& plugIn);

    /// An element of "paths": its canonical path, or as it was sent when it cannot be resolved.
    struct NamedPath {
        std::string path;
        bool resolved = false;
    };
    /// The request's "paths", and one of its elements; none when the failure has been sent.
    const platform::Array* requestedPaths();
    std::optional<NamedPath> namedPath(const platform::Array& paths, std::size_t index);
    /// Visits "paths" in order. True when every element was visited and none answered `Stop`;
    /// otherwise the failure has been sent.
    bool marshalPaths(const std::function<Walk(const NamedPath&)>& callback);

    /// What a request does to the registry at each of its paths.
    struct RegistryChange {
        Walk (Transaction::*prepare)(const NamedPath& path);
        std::optional<ZRError> (Transaction::*make)(const std::string& path);
        void (Transaction::*refuse)(const std::string& path);  // sends the failure
    };
    /// Visits "paths" in order from an element on, and sends the reply after the last one. The
    /// change itself is waited for beside the service queue, and ends with the sender.
    void processPaths(const RegistryChange& change, std::size_t from = 0);
    Walk prepareAdding(const NamedPath& path);
    std::optional<ZRError> add(const std::string& path);
    void refuseAdding(const std::string& path);
    Walk prepareRemoving(const NamedPath& path);
    std::optional<ZRError> remove(const std::string& path);
    void refuseRemoving(const std::string& path);
    /// Visits the plug-ins that "uuids" names, in order, from one on; answers as `marshalPaths`.
    bool processUuidList(const std::function<Walk(const std::shared_ptr<ZRDPlugIn>&)>& callback,
                         std::size_t first = 0);
    /// Sends the failure of "uuids" that are no list of UUIDs, or too many; answers false.
    bool failForBadUuids();
    /// Stores the plug-in's annotation, or an empty one, under "annotations".
    void addAnnotationForPlugIn(const ZRDPlugIn& plugIn, platform::Dictionary& in) const;

    /// The request's unsigned integer under a key; 0 when it is absent or of another kind.
    std::uint64_t unsignedUnder(const char* key) const;

    void done();
    void fail(std::int32_t code, const std::string& message);
    /// With the error's own code when it is one of ours, else with `code`.
    void fail(std::int32_t code, const ZRError& error);

    ZRDServer& server() const;
    /// Where the client comes from.
    platform::Origin origin() const;

    const std::shared_ptr<ZRDLumClient> client_;
    const platform::Message request_;
    const std::shared_ptr<RequestPaths> paths_;
    platform::Message reply_;
    std::optional<HostRestriction> hostRestriction_;
    bool hasUnsyncedAnnotations_ = false;
    std::atomic<std::uint64_t> version_{0};
};

}  // namespace zorvan
