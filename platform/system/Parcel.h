#pragma once

#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/system/Error.h"
#include "platform/system/UniqueFd.h"

namespace platform {

/// Bytes and descriptors that go together over a SOCK_SEQPACKET socket between processes that trust
/// each other.
struct Parcel {
    static constexpr std::size_t kMostBytes = 160u << 10;
    static constexpr std::size_t kMostDescriptors = 32;

    std::string bytes;
    std::vector<UniqueFd> descriptors;

    /// The next one, waiting for it. Error: the system's; EPIPE once the other end is closed,
    /// EMFILE when its descriptors could not be taken.
    static Result<Parcel> receive(int socket);
    /// The descriptors are borrowed. Error: the system's; EMSGSIZE for what is beyond the bounds.
    static std::optional<Error> send(int socket, std::string_view bytes,
                                     std::span<const int> descriptors);
};

}  // namespace platform
