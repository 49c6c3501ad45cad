#include "platform/system/Directories.h"

#include <pwd.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <optional>
#include <string_view>

namespace platform {

namespace {

/// Where the user's files would be without a home: nowhere.
constexpr const char* kNoHome = "/nonexistent";

std::optional<std::string> absolutePath(std::string_view text) {
    if (text.empty() || text.front() != '/') return std::nullopt;
    while (text.size() > 1 && text.back() == '/') text.remove_suffix(1);
    return std::string(text);
}

std::optional<std::string> fromVariable(const char* name) {
    const char* text = std::getenv(name);
    return text ? absolutePath(text) : std::nullopt;
}

std::optional<std::string> homeDirectory() {
    if (std::optional<std::string> home = fromVariable("HOME")) return home;
    std::vector<char> buffer(16384);
    passwd entry;
    passwd* found = nullptr;
    const int failure = ::getpwuid_r(::getuid(), &entry, buffer.data(), buffer.size(), &found);
    if (failure != 0 || !found || !found->pw_dir) return std::nullopt;
    return absolutePath(found->pw_dir);
}

std::vector<std::string> systemDataDirectories() {
    std::vector<std::string> result;
    const char* variable = std::getenv("XDG_DATA_DIRS");
    std::string_view rest = variable ? variable : "";
    while (!rest.empty()) {
        const std::size_t end = std::min(rest.find(':'), rest.size());
        if (std::optional<std::string> path = absolutePath(rest.substr(0, end)))
            result.push_back(*std::move(path));
        rest.remove_prefix(std::min(end + 1, rest.size()));
    }
    if (result.empty()) result = {"/usr/local/share", "/usr/share"};
    return result;
}

}  // namespace

Directories Directories::fromEnvironment() {
    const std::optional<std::string> home = homeDirectory();
    const auto inHome = [&](const char* variable, const char* relative) {
        if (std::optional<std::string> path = fromVariable(variable)) return *std::move(path);
        return home.value_or(kNoHome) + relative;
    };
    Directories result;
    result.runtime =
        fromVariable("XDG_RUNTIME_DIR").value_or("/run/user/" + std::to_string(::getuid()));
    result.dataHome = inHome("XDG_DATA_HOME", "/.local/share");
    result.dataDirs = systemDataDirectories();
    result.configHome = inHome("XDG_CONFIG_HOME", "/.config");
    result.stateHome =
        fromVariable("XDG_STATE_HOME").value_or(home ? *home + "/.local/state" : std::string());
    return result;
}

std::size_t userConfstr(const Directories& directories, int name, char* buffer, std::size_t size) {
    if (name != kUserDirectory) {
        errno = EINVAL;
        return 0;
    }
    const std::string& path = directories.stateHome;
    if (path.empty()) {
        errno = ENOENT;
        return 0;
    }
    if (size > 0) {
        const std::size_t copied = std::min(path.size(), size - 1);
        std::memcpy(buffer, path.data(), copied);
        buffer[copied] = '\0';
    }
    return path.size() + 1;
}

}  // namespace platform
