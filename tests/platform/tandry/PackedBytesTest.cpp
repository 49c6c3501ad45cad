#include "platform/tandry/PackedBytes.h"

#include <gtest/gtest.h>

namespace platform::tandry {

TEST(PackedBytes, GiveBackWhatWasPacked) {
    using namespace std::string_literals;
    const std::string zeros(255 + 256 + 3, '\0');
    for (const std::string& bytes :
         {std::string(), "a"s, "\0"s, "\0\0a"s, "a\0\x01\0"s, zeros, "a" + zeros + "\xFF"}) {
        EXPECT_EQ(PackedBytes(bytes).unpacked(), bytes);
        EXPECT_NE(PackedBytes(bytes), PackedBytes(bytes + '\0'));
    }
}

}  // namespace platform::tandry
