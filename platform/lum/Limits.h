#pragma once

#include <chrono>
#include <cstddef>

namespace platform::lum {

/// Largest payload of a frame that is a request, and of one that is a reply, in bytes.
inline constexpr std::size_t kMaxRequestPayload = 16u << 20;
inline constexpr std::size_t kMaxReplyPayload = 256u << 20;

/// Most values in a request, those inside others included. In memory a value is larger than the
/// byte that is enough to encode it.
inline constexpr std::size_t kMaxRequestValues = 1u << 18;

/// Most elements of a list in a request that stand for something each ("uuids", "paths", and the
/// entries of "annotations" in "bulk-annotate"): each costs up to 20 µs while everybody waits, the
/// change of an annotation several times that.
inline constexpr std::size_t kMaxListed = 4096;

/// A request with a larger payload is decoded on a thread of its own: so many values take longer
/// than others should wait for.
inline constexpr std::size_t kMaxDecodedAtOnce = 16u << 10;

/// A connection's next request is not served while more than this many bytes of its own replies, or
/// of the replies of all connections together, wait to be read by their hosts. A reply counts with
/// its whole length until its last byte is written: that is what its memory costs. Of the latter
/// one origin may fill a quarter; a reply that is larger than what is left of it may stand beyond,
/// one at a time, and does not count there.
inline constexpr std::size_t kMaxUnsentPerConnection = 8u << 20;
inline constexpr std::size_t kMaxUnsentTotal = 256u << 20;

/// A connection is not read on while this many requests, or this many bytes of requests, wait in
/// it.
inline constexpr std::size_t kMaxWaitingRequests = 64;
inline constexpr std::size_t kMaxWaitingBytes = 16u << 20;

/// A connection is read on only while the requests of all connections, from the moment that their
/// length is known until they are served, have no more than this many bytes together. So many bytes
/// of each connection are not counted. One origin may have a quarter of them.
inline constexpr std::size_t kMaxReceivedTotal = 256u << 20;
inline constexpr std::size_t kFreeReceived = 64u << 10;

/// When others wait because one of the two limits over all connections, or over those of one
/// origin, is reached, a connection that counts in it is cut off if its peer has been expected to
/// read, or to send the rest of a request, for so long and has moved less than this many bytes
/// meanwhile.
inline constexpr std::chrono::milliseconds kPatience{5000};
inline constexpr std::size_t kLeastProgress = 1u << 20;

/// Connections at the most, and how many descriptors each of them takes: with fewer descriptors
/// there are fewer connections. One origin has a quarter of them at the most.
inline constexpr std::size_t kMaxConnections = 65536;
inline constexpr std::size_t kDescriptorsOfConnection = 3;

/// No connection is accepted while fewer than this many file descriptors are left to the process:
/// what clients cannot use up is there for the work itself.
inline constexpr int kReservedDescriptors = 64;

}  // namespace platform::lum
