#include "platform/values/Cbor.h"

#include <gtest/gtest.h>

#include <cmath>
#include <sstream>

#include "platform/log/Log.h"
#include "platform/values/LazyDictionary.h"

namespace platform {
namespace {

std::string bytesOf(std::string_view hex) {
    std::string bytes;
    for (std::size_t i = 0; i + 1 < hex.size(); i += 2)
        bytes += static_cast<char>(std::stoi(std::string(hex.substr(i, 2)), nullptr, 16));
    return bytes;
}

Result<Value> decoded(std::string bytes, CborOptions options = CborOptions::Plain) {
    return decodeCbor(std::make_shared<const std::string>(std::move(bytes)), options);
}

TEST(Cbor, ValuesHaveOneEncoding) {
    struct Case {
        Value value;
        const char* hex;
    };
    for (const auto& [value, hex] : {
             Case{false, "f4"},
             Case{true, "f5"},
             Case{0, "00"},
             Case{24, "1818"},
             Case{UINT64_MAX, "1bffffffffffffffff"},
             Case{-1, "20"},
             Case{INT64_MIN, "3b7fffffffffffffff"},
             Case{1.5, "fb3ff8000000000000"},
             Case{"", "60"},
             Case{"\xC3\xBC", "62c3bc"},
             Case{Data(std::string("\0\xFF", 2)), "4200ff"},
             Case{Date{1.5}, "c1fb3ff8000000000000"},
             Case{*Uuid::parse("00112233-4455-6677-8899-AABBCCDDEEFF"),
                  "d8255000112233445566778899aabbccddeeff"},
             Case{Array(), "80"},
             Case{Array{1, Array{"a"}}, "8201816161"},
             Case{Dictionary(), "a0"},
             Case{Dictionary{{"b", 1}, {"aa", Dictionary{{"", 2}}}},
                  "a2626161a160026162"
                  "01"},
         }) {
        std::string encoded;
        encodeCbor(value, encoded);
        EXPECT_EQ(encoded, bytesOf(hex)) << hex;
        auto back = decoded(bytesOf(hex));
        ASSERT_TRUE(back) << hex << back.error().text;
        EXPECT_EQ(*back, value) << hex;
        EXPECT_EQ(back->kind(), value.kind()) << hex;
    }
}

TEST(Cbor, ReadsWhatOtherEncodersWrite) {
    struct Case {
        const char* hex;
        Value value;
    };
    for (const auto& [hex, value] : {
             Case{"1b0000000000000001", 1},
             Case{"f93e00", 1.5},
             Case{"fa3fc00000", 1.5},
             Case{"c118ff", Date{255}},
             Case{"c120", Date{-1}},
             Case{"b900026162016161"
                  "02",
                  Dictionary{{"a", 2}, {"b", 1}}},
         }) {
        auto value2 = decoded(bytesOf(hex));
        ASSERT_TRUE(value2) << hex << value2.error().text;
        EXPECT_EQ(*value2, value) << hex;
    }
}

TEST(Cbor, RefusesEverythingElse) {
    std::istringstream items(R"(
        18 61 616100 1bffffffff 3b8000000000000000 f6 f7 f0 f820 ff 1c 5f4100ff 7f6161ff 9f00ff
        bf616100ff 61ff 6100 62c080 63eda080 64f4908080 a161ff00 a1610000 a10102 a1f500 a1416100
        a2616101616102 a161610100 8200 a16161 c06161 c16161 c24100 c1c100 d8254700112233445566
        d8257061616161616161616161616161616161 d81800 d8186161 d9ffff00 5bffffffffffffffff00
        7bfffffffffffffff700 9bffffffffffffffff00 bb800000000000000000 9affffffff00)");
    std::string hex;  // the first is empty
    do {
        auto value = decoded(bytesOf(hex));
        ASSERT_FALSE(value) << hex << " is " << describe(*value);
        EXPECT_EQ(value.error().domain, "Cbor");
        EXPECT_NE(value.error().text.find("at offset"), std::string::npos);
    } while (items >> hex);
}

TEST(Cbor, DepthAndNumberOfValuesAreBounded) {
    auto arrays = [](std::size_t depth) { return std::string(depth - 1, '\x81') + '\x80'; };
    EXPECT_TRUE(decoded(arrays(kMaxCborDepth)));
    EXPECT_FALSE(decoded(arrays(kMaxCborDepth + 1)));
    EXPECT_FALSE(decoded(arrays(1 << 20)));
    std::string maps;
    for (int i = 0; i <= kMaxCborDepth; ++i) maps += bytesOf("a16161");
    EXPECT_FALSE(decoded(maps + "\x01"));

    std::string many = bytesOf("9a00200000") + std::string(1 << 21, '\x60');
    EXPECT_FALSE(decoded(many));
    // Every level claims as many elements as bytes are left: room for them would be 128 times that.
    std::string claims;
    for (int i = 0; i < kMaxCborDepth; ++i) claims += bytesOf("9a00400000");
    EXPECT_FALSE(decoded(claims + std::string(1 << 22, '\x9F')));
}

TEST(Cbor, PackedListsStayOpaqueUntilUnpacked) {
    Dictionary form{{"k", Array{1, "v"}}};
    Value packed = Packed(form);
    std::string encoded;
    encodeCbor(packed, encoded);
    EXPECT_EQ(encoded, bytesOf("d8185a00000007"
                               "a1616b82016176"));

    auto back = decoded(encoded);
    ASSERT_TRUE(back && back->packed());
    std::string again;
    encodeCbor(*back, again);
    EXPECT_EQ(again, encoded);
    auto value = unpack(*back->packed());
    ASSERT_TRUE(value);
    EXPECT_EQ(*value, form);

    EXPECT_TRUE(unpack(*decoded(bytesOf("d81841"
                                        "01"))
                            ->packed()));
    for (const char* hex : {"d81840", "d818420101", "d81841f6", "d818426101",
                            "d81853d8255000112233445566778899aabbccddeeff", "d81844d8184101"}) {
        auto outer = decoded(bytesOf(hex));
        ASSERT_TRUE(outer && outer->packed()) << hex;
        EXPECT_FALSE(unpack(*outer->packed())) << hex;
    }
    EXPECT_FALSE(unpack(Packed(Value(Uuid()))));
}

TEST(Cbor, KeptBytesAreWhatTheEncoderWouldWrite) {
    Dictionary inner{{"x", 1}, {"p", Packed(Array{1})}};
    Dictionary outer{{"in", inner}, {"list", Array{inner}}};
    std::string plain;
    encodeCbor(outer, plain);

    keepCborEncoded(inner);
    std::string withKept;
    encodeCbor(Dictionary{{"in", inner}, {"list", Array{inner}}}, withKept);
    EXPECT_EQ(withKept, plain);

    auto bytes = std::make_shared<const std::string>(plain);
    LazyDictionary lazy({bytes, *bytes}, nullptr);
    bytes.reset();
    EXPECT_EQ(*lazy.get().find("in")->dictionary()->find("x"), Value(1));
    ASSERT_TRUE(lazy.get().encoded());
    EXPECT_EQ(lazy.get().encoded()->bytes, plain);
    const Dictionary* kept = lazy.get().find("in")->dictionary();
    ASSERT_TRUE(kept->encoded());
    EXPECT_EQ(kept->encoded()->bytes, inner.encoded()->bytes);
    EXPECT_FALSE(decoded(plain)->dictionary()->encoded());
}

TEST(LazyDictionary, UnreadableBytesAreReportedAndEmpty) {
    static int faults = 0;
    for (const char* hex : {"a1", "01"}) {
        auto bytes = std::make_shared<const std::string>(bytesOf(hex));
        LazyDictionary lazy({bytes, *bytes}, [](std::string_view) { ++faults; });
        EXPECT_TRUE(lazy.get().empty());
        EXPECT_TRUE(lazy.get().empty());
    }
    EXPECT_EQ(faults, 2);
    EXPECT_EQ(LazyDictionary(Dictionary{{"a", 1}}).get(), (Dictionary{{"a", 1}}));
}

}  // namespace
}  // namespace platform
