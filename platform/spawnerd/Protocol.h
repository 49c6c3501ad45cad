#pragma once

#include <chrono>
#include <cstddef>
#include <string>

namespace platform::spawnerd {

/// The launcher's service: the daemon's service name with this behind it.
inline std::string serviceNameFor(const std::string& daemonService) {
    return daemonService + ".spawnerd";
}

/// Keys of its messages. Replies to what is refused have an errno under "errorcode" and a text for
/// people under "error".
inline constexpr const char* kRequest = "request";
inline constexpr const char* kExecutable = "executable";
inline constexpr const char* kArguments = "arguments";
inline constexpr const char* kInstance = "instance";
inline constexpr const char* kStatus = "status";
inline constexpr const char* kErrorCode = "errorcode";
inline constexpr const char* kError = "error";

/// Its requests.
inline constexpr const char* kStart = "start";
inline constexpr const char* kWait = "wait";
inline constexpr const char* kTerminate = "terminate";

/// What a plug-in is told in its environment: the number of the descriptor of its connection, its
/// bundle's identifier, and the service name of the daemon that started it.
inline constexpr const char* kConnectionVariable = "ZORVAN_PLUGIN_FD";
inline constexpr const char* kIdentifierVariable = "ZORVAN_BUNDLE_IDENTIFIER";
inline constexpr const char* kServiceVariable = "ZORVAN_SERVICE";
inline constexpr int kConnectionDescriptor = 3;

/// Instances at a time, of one host and of all; executables that one host may start.
inline constexpr std::size_t kMaxInstancesPerHost = 32;
inline constexpr std::size_t kMaxInstances = 256;
inline constexpr std::size_t kMaxGrantsPerHost = 1024;
/// How long a shut-down waits for instances to be gone.
inline constexpr std::chrono::seconds kShutDownPatience{2};
/// Requests that wait for the end of one instance.
inline constexpr std::size_t kMaxWaitersPerInstance = 16;
/// Ended instances of a host whose status it can still ask for.
inline constexpr std::size_t kMaxEndedPerHost = 64;
/// Arguments of an instance, and variables of its environment: how many, and how many bytes
/// together.
inline constexpr std::size_t kMaxStrings = 256;
inline constexpr std::size_t kMaxStringBytes = 64u << 10;

}  // namespace platform::spawnerd
