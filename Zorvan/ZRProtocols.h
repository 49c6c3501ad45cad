#pragma once

#include <optional>
#include <string>

#include "Zorvan/ZRError.h"
#include "platform/services/ObjectRuntime.h"
#include "platform/values/Value.h"

namespace zorvan {

/// Turns the names by which plug-ins tell how hosts talk to them into protocols and interfaces.
/// From any thread. Where an `error` may be passed, it is left alone on success.

/// The protocol of a name; null for an unknown one, which is logged and an error (code 12).
platform::ProtocolRef ZRProtocolNamed(platform::ObjectRuntime& runtime, const std::string& name,
                                      std::optional<ZRError>* error = nullptr);

/// The protocol of a name, or, for a list of names, the one that incorporates all of these, which
/// is made at its first use. Null, with an error (code 12), when one of them is unknown or it
/// cannot be made; without an error for what is neither.
platform::ProtocolRef ZRCompoundProtocol(platform::ObjectRuntime& runtime,
                                         const platform::Value& names,
                                         std::optional<ZRError>* error = nullptr);

/// Applies a description to the arguments of an operation. It is a list, separated by ",", of
///
///     <"request" or "reply">:<index>:<type>
///
/// for an argument of the call or of its reply, counted from 0; the type is "{" class names
/// separated by "+" "}" for the classes that are allowed there, or the protocol of a proxy. The
/// first entry that is wrong is an error (code 6) whose text is what is wrong; those before it stay
/// applied.
std::optional<ZRError> ZRDescribeInterface(platform::ObjectRuntime& runtime,
                                           platform::ObjectInterface& interface,
                                           const std::string& operation,
                                           const std::string& description);

}  // namespace zorvan
