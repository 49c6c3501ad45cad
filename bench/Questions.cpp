#include "bench/Questions.h"

#include <memory>

#include "Zorvan/Keys.h"
#include "bench/Failure.h"
#include "bench/Frames.h"
#include "bench/World.h"
#include "platform/values/Cbor.h"
#include "platform/values/VersionText.h"

namespace bench {

namespace {

using platform::Dictionary;
using platform::Value;

}  // namespace

// Every request has the same serial: only one waits at a time on a connection.
std::string requestFrame(const Dictionary& body) {
    constexpr std::uint64_t kRequestKind = 0;
    constexpr std::uint64_t kSerial = 1;
    std::string payload;
    platform::encodeCborArrayHead(3, payload);
    platform::encodeCborUnsigned(kRequestKind, payload);
    platform::encodeCborUnsigned(kSerial, payload);
    platform::encodeCbor(body, payload);
    return frameOf(payload);
}

namespace {

std::string matchRequest(const Dictionary& rules) {
    return requestFrame({{zorvan::message::kRequest, zorvan::request::kMatch},
                         {zorvan::message::kVersion, zorvan::kProtocolVersion},
                         {zorvan::message::kRules, rules},
                         {zorvan::message::kFlags, 0}});
}

Question question(std::string key, std::string pattern, std::size_t answers) {
    Dictionary rules{{key, Value(pattern)}};
    std::string frame = matchRequest(rules);
    return {std::move(key), std::move(pattern), answers, std::move(rules), std::move(frame)};
}

}  // namespace

Dictionary bodyOf(std::string_view frame) {
    auto payload = std::make_shared<const std::string>(frame.substr(kFrameHead));
    const platform::Result<Value> item = platform::decodeCbor(std::move(payload));
    if (!item) fail("a reply cannot be decoded: {}", item.error().text);
    const platform::Array* parts = item->array();
    const Dictionary* body = parts && parts->size() == 3 ? (*parts)[2].dictionary() : nullptr;
    if (!body) fail("a reply is no message");
    if (const Value* error = body->find(zorvan::message::kError)) {
        fail("the daemon answered with an error: {}", describe(*error));
    }
    return *body;
}

namespace {

const Value* attributeOf(const Value& form, const std::string& key) {
    const Dictionary* plugIn = form.dictionary();
    for (const char* step : {zorvan::form::kInfo, zorvan::key::kAttributes}) {
        const Value* next = plugIn ? plugIn->find(step) : nullptr;
        plugIn = next ? next->dictionary() : nullptr;
    }
    return plugIn ? plugIn->find(key) : nullptr;
}

platform::Array formsIn(std::string_view frame) {
    const Dictionary body = bodyOf(frame);
    const Value* matches = body.find(zorvan::message::kMatches);
    if (!matches || !matches->packed()) fail("a reply has no matches");
    const platform::Result<Value> forms = platform::unpack(*matches->packed());
    if (!forms || !forms->array()) fail("the matches of a reply are no list");
    return *forms->array();
}

bool isRight(const Question& question, const Value& attribute) {
    if (!question.pattern.starts_with('<')) return attribute == Value(question.pattern);
    const std::string_view operand = std::string_view(question.pattern).substr(1);
    return attribute.string() && platform::compareVersionString(*attribute.string(), operand) < 0;
}

/// How many answers a reply holds, and how many of them were asked for.
struct Count {
    std::size_t answers = 0;
    std::size_t right = 0;
};

Count countAnswers(const Question& question, std::string_view frame) {
    Count count;
    for (const Value& form : formsIn(frame)) {
        ++count.answers;
        const Value* attribute = attributeOf(form, question.key);
        if (attribute && isRight(question, *attribute)) ++count.right;
    }
    return count;
}

}  // namespace

Question Question::byPoint(std::size_t answers) {
    return byPointNamed(World::pointOf(answers), answers);
}

Question Question::byPointNamed(std::string point, std::size_t answers) {
    return question(zorvan::key::kExtensionPoint, std::move(point), answers);
}

Question Question::ofAll(std::size_t answers) {
    return {{}, {}, answers, {}, matchRequest({})};
}

Question Question::byRareAttribute() {
    return question(World::kRareAttribute, World::kRareValue, 10);
}

Question Question::byOrder() {
    return question(World::kNumberAttribute, "<10", 10);
}

std::string smallRequest() {
    return requestFrame({{zorvan::message::kRequest, zorvan::request::kBulk},
                         {zorvan::message::kVersion, zorvan::kProtocolVersion},
                         {zorvan::message::kFlags, 0}});
}

std::string readyRequest(const platform::Uuid& uuid) {
    return requestFrame({{zorvan::message::kRequest, zorvan::request::kReady},
                         {zorvan::message::kVersion, zorvan::kProtocolVersion},
                         {zorvan::message::kUuids, platform::Array{uuid}}});
}

std::string annotateRequest(const platform::Uuid& uuid) {
    return requestFrame(
        {{zorvan::message::kRequest, zorvan::request::kAnnotate},
         {zorvan::message::kVersion, zorvan::kProtocolVersion},
         {zorvan::message::kUuids, platform::Array{uuid}},
         {zorvan::message::kAnnotations, Dictionary{{zorvan::annotation::kElection, 1}}}});
}

std::string bulkAnnotateRequest(const std::vector<platform::Uuid>& uuids) {
    Dictionary annotations;
    for (const platform::Uuid& uuid : uuids)
        annotations.set(uuid.string(), Dictionary{{"order", "after the others"}});
    return requestFrame({{zorvan::message::kRequest, zorvan::request::kBulkAnnotate},
                         {zorvan::message::kVersion, zorvan::kProtocolVersion},
                         {zorvan::message::kAnnotations, annotations}});
}

std::vector<platform::Uuid> uuidsIn(std::string_view frame) {
    std::vector<platform::Uuid> uuids;
    for (const Value& form : formsIn(frame)) {
        const Value* text =
            form.dictionary() ? form.dictionary()->find(zorvan::form::kUuid) : nullptr;
        const auto uuid =
            text && text->string() ? platform::Uuid::parse(*text->string()) : std::nullopt;
        if (!uuid) fail("a match has no UUID");
        uuids.push_back(*uuid);
    }
    return uuids;
}

std::vector<std::string> pathsIn(std::string_view frame) {
    std::vector<std::string> paths;
    for (const Value& form : formsIn(frame)) {
        const Value* path =
            form.dictionary() ? form.dictionary()->find(zorvan::form::kPath) : nullptr;
        if (!path || !path->string()) fail("a match has no path");
        paths.push_back(path->string()->string());
    }
    return paths;
}

void expectSuccess(std::string_view frame) {
    if (!bodyOf(frame).empty()) fail("a small reply carries data");
}

bool isAnswered(const Question& question, std::string_view frame) {
    const Count count = countAnswers(question, frame);
    return count.answers == question.answers && count.right == question.answers;
}

void expectAnswered(const Question& question, std::string_view frame) {
    const Count count = countAnswers(question, frame);
    if (count.answers == question.answers && count.right == question.answers) return;
    fail("a match of {} \"{}\" must find {} plug-ins: it found {}, {} of them right", question.key,
         question.pattern, question.answers, count.answers, count.right);
}

}  // namespace bench
