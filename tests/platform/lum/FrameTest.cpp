#include "platform/lum/Frame.h"

#include <gtest/gtest.h>

#include <fstream>
#include <string>
#include <vector>

#include "platform/lum/Limits.h"
#include "platform/values/Cbor.h"

namespace platform::lum {
namespace {

/// The byte blocks ("```hex") of the protocol's description; what follows a ";" is comment.
std::vector<std::string> documentedFrames() {
    std::ifstream document(ZR_SOURCE_DIR "/docs/protocol.md");
    std::vector<std::string> frames;
    bool inside = false;
    for (std::string line; std::getline(document, line);) {
        if (line.starts_with("```")) {
            inside = line == "```hex";
            if (inside) frames.emplace_back();
        } else if (inside) {
            std::string digits;
            for (char c : line.substr(0, line.find(';')))
                if (!std::isspace(static_cast<unsigned char>(c))) digits += c;
            for (std::size_t i = 0; i + 1 < digits.size(); i += 2)
                frames.back() += static_cast<char>(std::stoi(digits.substr(i, 2), nullptr, 16));
        }
    }
    return frames;
}

TEST(Frame, IsWhatTheDescriptionShows) {
    Message request({{"flags", 0},
                     {"request", "match"},
                     {"rules", Dictionary{{"VXExtensionPointIdentifier", "com.example.share"}}},
                     {"version", 3}});
    request.setSerial(1);
    Message reply = Message::replyTo(request);
    reply.set("error", "invalid request format (bad rules dictionary)");
    reply.set("errorcode", 4);
    EXPECT_EQ(documentedFrames(),
              (std::vector{encodeFrame(FrameKind::Request, request, 1000)->string(),
                           encodeFrame(FrameKind::Reply, reply, 1000)->string()}));
}

TEST(Frame, OverTheLimitIsNotEncoded) {
    Message message({{"key", std::string(100, 'x')}});
    EXPECT_TRUE(encodeFrame(FrameKind::Reply, message, 200));
    EXPECT_FALSE(encodeFrame(FrameKind::Reply, message, 100));
    message.set("key", std::string(100'000, 'x'));
    EXPECT_GT(describe(message).size(), 100'000u) << "tracers are told all of it";
}

DecodedPayload decode(std::string_view payload, FrameKind expected = FrameKind::Request) {
    return decodePayload(std::make_shared<const std::string>(payload), expected);
}

TEST(Frame, TellsMessagesFromOtherItemsAndFromGarbage) {
    using namespace std::string_view_literals;
    auto message = decode("\x83\x00\x18\x2a\xa1\x61k\x01"sv);
    ASSERT_TRUE(std::holds_alternative<Message>(message));
    EXPECT_EQ(std::get<Message>(message).serial(), 42u);
    EXPECT_EQ(std::get<Message>(message).contents(), (Dictionary{{"k", 1}}));

    for (auto item :
         {"\x83\x01\x01\xa0"sv, "\x83\x02\x01\xa0"sv, "\x83\x00\x20\xa0"sv, "\x83\x00\x01\x80"sv,
          "\x82\x00\x01"sv, "\x84\x00\x01\xa0\x00"sv, "\x61x"sv, "\xa0"sv, "\x83\xf4\x01\xa0"sv})
        EXPECT_TRUE(std::holds_alternative<UnknownObject>(decode(item)));
    EXPECT_TRUE(std::holds_alternative<Message>(decode("\x83\x01\x01\xa0"sv, FrameKind::Reply)));

    for (auto garbage : {""sv, "\x83\x00\x01"sv, "\x83\x00\x01\xa0\x00"sv, "\x83\x00\x01\xf6"sv})
        EXPECT_TRUE(std::holds_alternative<Error>(decode(garbage)));
}

TEST(Frame, LimitsTheValuesOfRequestsButNotOfReplies) {
    const auto decodeBody = [](std::size_t values, FrameKind kind) {
        const std::vector<Value> list(values - 5, Value(0));  // in [kind, serial, {"k": list}]
        Message message(Dictionary{{"k", Array(list)}});
        std::string bytes = encodeFrame(kind, message, kMaxReplyPayload)->string();
        return decode(std::string_view(bytes).substr(kFrameHeaderSize), kind);
    };
    EXPECT_TRUE(std::holds_alternative<Message>(decodeBody(kMaxRequestValues, FrameKind::Request)));
    EXPECT_TRUE(
        std::holds_alternative<Error>(decodeBody(kMaxRequestValues + 1, FrameKind::Request)));
    EXPECT_TRUE(std::holds_alternative<Message>(decodeBody(2 * kMaxCborValues, FrameKind::Reply)));
}

TEST(Frame, ASenderKnowsWhatItsReceiverWouldRefuse) {
    const auto nested = [](int levels, auto around) {
        Value value = 1;
        for (int i = 0; i < levels; ++i) value = around(value);
        return value;
    };
    const auto arrays = [](Value value) { return Value(Array{std::move(value)}); };
    const auto maps = [](Value value) { return Value(Dictionary{{"k", std::move(value)}}); };
    constexpr int kDeepest = kMaxCborDepth - 2;  // in [kind, serial, {"k": ...}]
    const std::pair<Value, bool> cases[] = {
        {nested(kDeepest, arrays), true},
        {nested(kDeepest + 1, arrays), false},
        {nested(kDeepest, maps), true},
        {nested(kDeepest + 1, maps), false},
        {Array(std::vector<Value>(kMaxRequestValues - 5, Value(0))), true},
        {Array(std::vector<Value>(kMaxRequestValues - 4, Value(0))), false},
        {Array{"\xc3\xa4", Data(std::string("\0\xff", 2)), Uuid::random(), Date{1}}, true},
        {Packed(Value("\xff")), true},
        {"\xff", false},
        {std::string("\0", 1), false},
        {Dictionary{{"\xff", 1}}, false},
    };
    for (const auto& [value, isTaken] : cases) {
        const Message message(Dictionary{{"k", value}});
        EXPECT_EQ(!whatIsWrongWith(message.contents()), isTaken) << describe(value).substr(0, 80);
        const std::string bytes =
            encodeFrame(FrameKind::Request, message, kMaxReplyPayload)->string();
        const auto decoded = decode(std::string_view(bytes).substr(kFrameHeaderSize));
        EXPECT_EQ(std::holds_alternative<Message>(decoded), isTaken);
    }
}

TEST(FrameReader, PutsPiecesTogetherAndCutsRuns) {
    std::string stream;
    std::vector<std::string> payloads{"a", "", std::string(300, 'b'), std::string(70000, 'c')};
    for (const std::string& payload : payloads) {
        stream += std::string(1, '\0') + static_cast<char>(payload.size() >> 16);
        stream += static_cast<char>(payload.size() >> 8);
        stream += static_cast<char>(payload.size());
        stream += payload;
    }
    for (std::size_t step : {std::size_t{1}, std::size_t{7}, stream.size()}) {
        FrameReader reader(70000);
        std::vector<std::string> taken;
        for (std::size_t at = 0; at < stream.size(); at += step) {
            std::string_view input = std::string_view(stream).substr(at, step);
            while (true) {
                auto payload = reader.take(input);
                ASSERT_TRUE(payload);
                if (!*payload) break;
                taken.push_back(**payload);
            }
            EXPECT_TRUE(input.empty());
        }
        EXPECT_EQ(taken, payloads);
        EXPECT_FALSE(reader.insideFrame());
    }
    FrameReader strict(69999);
    std::string_view input = stream;
    for (int i = 0; i < 3; ++i) EXPECT_TRUE(strict.take(input));
    EXPECT_FALSE(strict.take(input));
}

}  // namespace
}  // namespace platform::lum
