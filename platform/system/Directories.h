#pragma once

#include <cstddef>
#include <string>
#include <vector>

namespace platform {

/// The places of this user's files, as the XDG base directory rules name them. A plain value, made
/// once and handed to whoever needs it. Nothing is created here.
struct Directories {
    std::string runtime;                // $XDG_RUNTIME_DIR, else /run/user/<uid>
    std::string dataHome;               // $XDG_DATA_HOME, else ~/.local/share
    std::vector<std::string> dataDirs;  // $XDG_DATA_DIRS, else /usr/local/share and /usr/share
    std::string configHome;             // $XDG_CONFIG_HOME, else ~/.config
    std::string stateHome;  // $XDG_STATE_HOME, else ~/.local/state; empty without a home

    /// Reads the environment. Values that are not absolute paths count as unset; without HOME the
    /// home is the one of the user database; without that either, there is no state home and the
    /// other places lie under a directory that does not exist.
    static Directories fromEnvironment();

    /// <runtime>/zorvan
    std::string zorvanRuntime() const { return runtime + "/zorvan"; }
    /// <dataHome>/zorvan
    std::string zorvanData() const { return dataHome + "/zorvan"; }
};

/// The name of the per-user private directory for `userConfstr`.
inline constexpr int kUserDirectory = 0x10000;

/// The per-user private directory (`stateHome`), by the rules of the POSIX `confstr`: copies the
/// text and its terminating zero into `buffer` as far as they fit, and answers the size that the
/// whole needs. 0, with errno set, when there is no such directory or `name` is unknown.
std::size_t userConfstr(const Directories& directories, int name, char* buffer, std::size_t size);

}  // namespace platform
