#include "bench/LibraryClient.h"

#include <chrono>
#include <cstdlib>
#include <future>
#include <string>

#include "Zorvan/Keys.h"
#include "bench/Failure.h"
#include "bench/Measure.h"

namespace bench {

namespace {

using platform::Value;

/// Reads every value; the sum keeps the compiler from leaving any out.
std::size_t visit(const Value& value) {
    switch (value.kind()) {
        case Value::Kind::Array: {
            std::size_t sum = 1;
            for (const Value& element : *value.array()) sum += visit(element);
            return sum;
        }
        case Value::Kind::Dictionary: {
            std::size_t sum = 1;
            for (const auto& [key, element] : *value.dictionary())
                sum += key.size() + visit(element);
            return sum;
        }
        case Value::Kind::String:
            return value.string()->size();
        case Value::Kind::Data:
            return value.data()->bytes().size();
        default:
            return static_cast<std::size_t>(value.numberAsInteger().value_or(1));
    }
}

struct Outcome {
    std::size_t matches = 0;
    std::size_t sum = 0;
    double finished = 0;
    std::string error;
};

Outcome visitReply(const zorvan::ZRDaemonClient& client,
                   const zorvan::ZRDaemonClient::Reply& reply) {
    Outcome outcome;
    if (auto error = zorvan::ZRDaemonClient::errorInReply(reply)) {
        outcome.error = error->description.value_or("an error without a text");
        return outcome;
    }
    const Value* packed = std::get<platform::Message>(reply).find(zorvan::message::kMatches);
    const std::optional<Value> matches = packed ? client.convertFromLum(*packed) : std::nullopt;
    if (!matches || !matches->array()) {
        outcome.error = "no matches";
        return outcome;
    }
    outcome.matches = matches->array()->size();
    outcome.sum = visit(*matches);
    outcome.finished = now();
    return outcome;
}

}  // namespace

LibraryClient::LibraryClient(const World& world) {
    ::setenv("XDG_RUNTIME_DIR", world.runtimeDirectory().c_str(), 1);
    client_ = zorvan::ZRDaemonClient::initWithServiceName(nullptr);
}

double LibraryClient::matchAndVisit(const Question& question) {
    auto promise = std::make_shared<std::promise<Outcome>>();
    std::future<Outcome> future = promise->get_future();
    const double start = now();
    client_->matchPlugIns(question.rules, 0, [promise, client = client_.get()](const auto& reply) {
        promise->set_value(visitReply(*client, reply));
    });
    if (future.wait_for(std::chrono::minutes(1)) != std::future_status::ready) {
        fail("no reply through the client library within a minute");
    }
    const Outcome outcome = future.get();
    if (!outcome.error.empty()) fail("through the client library: {}", outcome.error);
    if (outcome.matches != question.answers || outcome.sum == 0) {
        fail("{} matches through the client library instead of {}", outcome.matches,
             question.answers);
    }
    return outcome.finished - start;
}

}  // namespace bench
