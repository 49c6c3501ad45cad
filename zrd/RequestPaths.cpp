#include "zrd/RequestPaths.h"

#include <sys/stat.h>

#include "platform/system/Files.h"
#include "platform/values/Utf8.h"

namespace zorvan {

namespace {

/// A resolved path of this many bytes or more counts as not resolved.
constexpr std::size_t kMaxResolvedPath = 1024;

/// Resolves a path; done when what lies there, and in it, has answered as well: a path up to where
/// a file system begins says nothing about that.
std::optional<std::string> resolveAnswering(const std::string& path) {
    auto canonical = platform::canonicalPath(path, kMaxResolvedPath);
    // A reply could not carry other paths, and the registry has no bundles there.
    if (!canonical || !platform::isValidUtf8(*canonical)) return std::nullopt;
    struct stat ignored;
    for (const std::string& place : {*canonical, platform::joinPath(*canonical, "Info.plist")})
        static_cast<void>(::stat(place.c_str(), &ignored));
    return canonical;
}

}  // namespace

void RequestPaths::resolve(platform::PeerLooks::Pace& pace, const std::function<bool()>& isWanted) {
    resolved_.resize(paths_.size());
    for (std::size_t i = 0; i < paths_.size() && isWanted(); ++i) {
        const auto* path = paths_[i].string();
        if (!path || !path->view().starts_with('/')) return;
        resolved_[i] = resolveAnswering(path->string());
        pace.step();
    }
}

std::optional<std::string> RequestPaths::resolved(std::size_t index) const {
    return index < settled_ ? resolved_[index] : std::nullopt;
}

}  // namespace zorvan
