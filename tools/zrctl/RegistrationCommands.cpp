#include "tools/zrctl/RegistrationCommands.h"

#include <fmt/core.h>

#include <filesystem>
#include <vector>

#include "platform/system/Files.h"
#include "platform/values/Utf8.h"
#include "tools/zrctl/Session.h"

using platform::Error;
using platform::Result;

namespace zrctl {

Result<std::string> absolutePath(const std::string& path, std::string_view directory) {
    std::string absolute = path.starts_with('/') ? path : platform::joinPath(directory, path);
    if (path.empty()) return Error{"zrctl", 0, "a path is empty"};
    if (!platform::isValidUtf8(absolute))
        return Error{"zrctl", 0, fmt::format("{}: the path is not UTF-8 text", absolute)};
    return absolute;
}

std::variant<std::vector<std::string>, Outcome> absolutePaths(
    const std::vector<std::string>& paths) {
    std::error_code noDirectory;
    const std::string directory = std::filesystem::current_path(noDirectory).string();
    if (noDirectory)
        return Outcome::failure(
            fmt::format("cannot tell the current directory: {}", noDirectory.message()));
    std::vector<std::string> found;
    for (const std::string& path : paths) {
        const Result<std::string> absolute = absolutePath(path, directory);
        if (!absolute) return Outcome::usage(absolute.error().text);
        found.push_back(*absolute);
    }
    return found;
}

Outcome runRegistration(const Options& options) {
    const auto absolute = absolutePaths(options.paths);
    if (const auto* outcome = std::get_if<Outcome>(&absolute)) return *outcome;
    const auto& paths = std::get<std::vector<std::string>>(absolute);

    Session session(options.service);
    const auto reply = session.ask([&](auto& client, const auto& callback) {
        if (options.command == Options::Command::Add)
            client.addPlugIns(paths, callback);
        else
            client.removePlugIns(paths, callback);
    });
    return reply ? Outcome{} : Outcome::failure(reply.error().text);
}

}  // namespace zrctl
