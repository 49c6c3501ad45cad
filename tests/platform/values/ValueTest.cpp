#include "platform/values/Value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <limits>
#include <thread>

namespace platform {
namespace {

TEST(Value, NumbersCompareByValueAndOnlyWithNumbers) {
    const double above = std::nextafter(0x1p63, INFINITY);
    struct Case {
        Value a, b;
        bool equal;
    };
    for (const auto& [a, b, equal] :
         {Case{true, 1, true}, Case{false, 0.0, true}, Case{true, 2, false},
          Case{-1, UINT64_MAX, false}, Case{UINT64_MAX, 0x1p64, false},
          Case{INT64_MAX, 0x1p63, false},  // rounding the integer would make them equal
          Case{std::uint64_t{1} << 63, 0x1p63, true}, Case{INT64_MIN, -0x1p63, true},
          Case{std::uint64_t{1} << 63, above, false}, Case{1, 1.5, false},
          Case{0, std::nan(""), false}, Case{1, "1", false}, Case{0, Array(), false},
          Case{Date{1}, 1, false}, Case{"a", "a", true}, Case{Data("a"), "a", false},
          Case{Array{1, true}, Array{true, 1.0}, true},
          Case{Packed(Value(1)), Packed(Value(true)), true}, Case{Packed(Value(1)), 1, false}}) {
        EXPECT_EQ(a == b, equal) << describe(a) << " / " << describe(b);
        EXPECT_EQ(b == a, equal) << describe(b) << " / " << describe(a);
    }
}

TEST(Value, IntegersAreReadInTheRangeTheyFit) {
    EXPECT_EQ(Value(-1).unsignedInteger(), std::nullopt);
    EXPECT_EQ(Value(UINT64_MAX).signedInteger(), std::nullopt);
    EXPECT_EQ(Value(std::uint64_t{5}).signedInteger(), 5);
    EXPECT_EQ(Value(true).unsignedInteger(), std::nullopt);
    EXPECT_EQ(Value(UINT64_MAX).numberAsInteger(), INT64_MAX);
    EXPECT_EQ(Value(-1e300).numberAsInteger(), INT64_MIN);
    EXPECT_EQ(Value(-2.7).numberAsInteger(), -2);
    EXPECT_EQ(Value("3").numberAsInteger(), std::nullopt);
    EXPECT_EQ(Value(UINT64_MAX - 1).numberAsBits(), UINT64_MAX - 1);
    EXPECT_EQ(Value(-1.5).numberAsBits(), UINT64_MAX);
}

TEST(Dictionary, ChangingACopyLeavesTheOriginal) {
    Dictionary original{{"b", 1}, {"a", 2}, {"b", 3}};
    original.keepEncoded({nullptr, "bytes"});
    Dictionary changed = original;
    changed.set("c", 4);
    changed.remove("a");
    EXPECT_EQ(original, (Dictionary{{"a", 2}, {"b", 3}}));
    EXPECT_EQ(changed, (Dictionary{{"b", 3}, {"c", 4}}));
    EXPECT_TRUE(original.encoded().has_value());
    EXPECT_FALSE(changed.encoded().has_value());
    original.remove("absent");
    EXPECT_TRUE(original.encoded().has_value());
    original.set("a", 2);  // alone in its storage now
    EXPECT_FALSE(original.encoded().has_value());

    Dictionary().keepEncoded({nullptr, "bytes"});
    EXPECT_FALSE(Dictionary().encoded().has_value());
    EXPECT_FALSE(Dictionary::fromEntries({{"b", 1}, {"a", 1}, {"b", 2}}));
    EXPECT_EQ(Dictionary::fromEntries({{"b", 1}, {"a", 2}}), (Dictionary{{"a", 2}, {"b", 1}}));

    Array list{1, 2};
    Array copy = list;
    copy.remove(0);
    copy.append(3);
    EXPECT_EQ(list, (Array{1, 2}));
    EXPECT_EQ(copy, (Array{2, 3}));
}

TEST(Dictionary, CopiesOfOneStorageAreChangedInSeveralThreads) {
    Dictionary shared{{"a", 1}, {"b", Array{1, 2}}};
    std::vector<std::jthread> threads;
    for (int i = 0; i < 4; ++i) {
        threads.emplace_back([copy = shared, i]() mutable {
            for (int round = 0; round < 200; ++round) {
                Dictionary next = copy;
                next.keepEncoded({nullptr, "bytes"});
                next.set("a", Value(i + static_cast<int>(next.size())));
                EXPECT_EQ(next.find("b")->array()->size(), 2U);
            }
        });
    }
    // Changes in place once the threads have dropped their copies, whenever that is.
    for (int round = 0; round < 200; ++round) shared.set("c", round);
    threads.clear();
    shared.set("a", 7);
    EXPECT_EQ(shared, (Dictionary{{"a", 7}, {"b", Array{1, 2}}, {"c", 199}}));
}

TEST(Value, PropertyListsHoldOnlyWhatFilesGiveBack) {
    auto nested = [](int depth) {
        Value value = 1;
        for (int i = 0; i < depth; ++i)
            value = i % 2 ? Value(Array{value}) : Value(Dictionary{{"k", value}});
        return value;
    };
    for (const Value& good : {Value("a\t\r\n \xEF\xBF\xBD"), Value(Data(std::string(1, '\0'))),
                              Value(Date{-1e10}), nested(64)}) {
        EXPECT_TRUE(isPropertyList(good)) << describe(good);
    }
    for (const Value& bad :
         {Value(Uuid()), Value(Packed(Value(1))), Value("a\x01"), Value(std::string(1, '\0')),
          Value("\xEF\xBF\xBE"), Value("\xEF\xBF\xBF"), Value("\xC3"), Value("\xED\xA0\x80"),
          Value(Date{std::nan("")}), Value(Date{1e12}), nested(65)}) {
        EXPECT_FALSE(isPropertyList(bad)) << describe(bad);
        EXPECT_FALSE(isPropertyList(Array{Dictionary{{"k", bad}}})) << describe(bad);
    }
    EXPECT_FALSE(isPropertyList(Dictionary{{"\x1B", 1}}));
}

TEST(Uuid, ReadsItsTextFormOnly) {
    auto uuid = Uuid::parse("0a1B2c3d-0000-4000-8000-0000000000ff");
    ASSERT_TRUE(uuid);
    EXPECT_EQ(uuid->string(), "0A1B2C3D-0000-4000-8000-0000000000FF");
    for (auto text :
         {"", "0a1B2c3d000040008000000000000000ffff", "0a1B2c3d-0000-4000-8000-0000000000f",
          "0a1B2c3d-0000-4000-8000-0000000000fg", "{a1B2c3d-0000-4000-8000-0000000000f}"}) {
        EXPECT_FALSE(Uuid::parse(text)) << text;
    }
}

TEST(Describe, IsCutWhereItGrowsWithoutEnd) {
    Array list{std::string(1000, 'x')};
    // More elements, counted through, than anybody could walk.
    for (int i = 0; i < 40; ++i) list = Array{list, list, list, list};
    EXPECT_LT(describe(list).size(), 70'000U);
    EXPECT_EQ(describe(Value(Dictionary{{"a", Array{true, "s", -1}}, {"b", Packed(Value(1.5))}})),
              R"({a: [true, "s", -1], b: 1.5})");
}

}  // namespace
}  // namespace platform
