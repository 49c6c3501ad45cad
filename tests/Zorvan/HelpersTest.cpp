#include "Zorvan/Helpers.h"

#include <gtest/gtest.h>

namespace zorvan {
namespace {

TEST(CompareVersionString, OrdersDigitRunsByValueAndTheRestByByte) {
    struct Case {
        const char* receiver;
        const char* other;
        int order;
    };
    for (auto [receiver, other, order] : {
             Case{"", "", 0},
             {"", "0", -1},
             {"1.10", "1.9", 1},
             {"10", "9", 1},
             {"2.0", "2.0.1", -1},
             {"1.0a", "1.0A", 1},
             {"01.002", "1.2", 0},
             {"000", "0", 0},
             {"1.x", "1.10", 1},
             {"18446744073709551616", "18446744073709551615", 1},
             {"a", "\xC3\xA4", -1},
             {"\xD9\xA1", "234", 1},  // another script's digit
             {"\xEF\xBD\x81", "\xF0\x90\x80\x80", -1},
         }) {
        EXPECT_EQ(compareVersionString(receiver, other), order) << receiver << " / " << other;
        EXPECT_EQ(compareVersionString(other, receiver), -order) << other << " / " << receiver;
        EXPECT_EQ(canonicalVersionString(receiver) == canonicalVersionString(other), order == 0);
    }
}

TEST(DictionaryChanging, LeavesItsReceiverAlone) {
    platform::Dictionary empty;
    platform::Dictionary one = dictionaryChanging(empty, "election", platform::Value(1));
    EXPECT_TRUE(empty.empty());
    EXPECT_EQ(one, (platform::Dictionary{{"election", 1}}));
    EXPECT_TRUE(dictionaryChanging(one, "election", std::nullopt).empty());
    EXPECT_EQ(one.size(), 1u);
}

TEST(ArrayWithValues, DropsAbsentAnswers) {
    auto array = arrayWithValues(std::initializer_list<int>{1, 2, 3},
                                 [](int n) -> std::optional<platform::Value> {
                                     if (n == 2) return std::nullopt;
                                     return n;
                                 });
    EXPECT_EQ(array, (platform::Array{1, 3}));
}

}  // namespace
}  // namespace zorvan
