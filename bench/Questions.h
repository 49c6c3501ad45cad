#pragma once

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

#include "platform/values/Value.h"

namespace bench {

/// A match that is asked for, and how many plug-ins must be in its reply.
struct Question {
    std::string key;  // the rule's key and pattern: every answer has such an attribute
    std::string pattern;
    std::size_t answers;
    platform::Dictionary rules;
    std::string frame;  // the request

    static Question byPoint(std::size_t answers);
    static Question byRareAttribute();
    /// By order, on an attribute that all have: no equality narrows it.
    static Question byOrder();
    static Question byPointNamed(std::string point, std::size_t answers);
    /// Every plug-in there is: without rules, so only the number of answers can be checked.
    static Question ofAll(std::size_t answers);
};

/// A request with the message `body`, as a frame.
std::string requestFrame(const platform::Dictionary& body);
/// The message in a reply frame. Throws a `Failure` with its text when it is an error, or no reply.
platform::Dictionary bodyOf(std::string_view frame);

/// The request that does nothing ("bulk"), as a frame.
std::string smallRequest();

/// The request that makes a plug-in ready.
std::string readyRequest(const platform::Uuid& uuid);

/// Requests that set the election of a plug-in, and the extensions of several.
std::string annotateRequest(const platform::Uuid& uuid);
std::string bulkAnnotateRequest(const std::vector<platform::Uuid>& uuids);

/// Whether a reply frame is a success without data. Throws a `Failure` with its text when it is an
/// error, or no reply.
void expectSuccess(std::string_view frame);

/// The plug-ins in a match's reply frame.
std::vector<platform::Uuid> uuidsIn(std::string_view frame);
/// The bundles of the plug-ins in a match's reply frame.
std::vector<std::string> pathsIn(std::string_view frame);

/// Whether a reply frame holds just the plug-ins that were asked for.
bool isAnswered(const Question& question, std::string_view frame);
/// Throws a `Failure` when not.
void expectAnswered(const Question& question, std::string_view frame);

}  // namespace bench
