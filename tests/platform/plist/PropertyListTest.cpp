#include "platform/plist/PropertyList.h"

#include <gtest/gtest.h>

#include <cfloat>
#include <clocale>
#include <cmath>
#include <fstream>
#include <limits>
#include <sstream>

namespace platform {
namespace {

std::string xml(const std::string& content) {
    return "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<!DOCTYPE plist PUBLIC \"-//x//DTD\" "
           "\"http://x/y.dtd\">\n<plist version=\"1.0\">" +
           content + "</plist>\n";
}

std::string repeated(const std::string& text, int count) {
    std::string result;
    for (int i = 0; i < count; ++i) result += text;
    return result;
}

/// A binary list of the given objects, the first of which is the root; references and offsets have
/// two bytes.
std::string binary(const std::vector<std::string>& objects) {
    auto number = [](std::size_t value, int size) {
        std::string bytes;
        for (int i = size - 1; i >= 0; --i) bytes += static_cast<char>(value >> (8 * i));
        return bytes;
    };
    std::string bytes = "bplist00";
    std::string table;
    for (const auto& object : objects) {
        table += number(bytes.size(), 2);
        bytes += object;
    }
    std::size_t tableAt = bytes.size();
    return bytes + table + std::string(6, '\0') + "\x02\x02" + number(objects.size(), 8) +
           number(0, 8) + number(tableAt, 8);
}

std::string literal(const char* text, std::size_t size) {
    return {text, size};
}
#define BYTES(text) literal(text, sizeof(text) - 1)

TEST(PropertyList, WhatIsWrittenIsReadBack) {
    Value value = Dictionary{
        {"", "empty key"},
        {"<&>\"'", "<&>\"' ]]> <!-- \r\n\t lines \r end "},
        {"numbers",
         Array{0, -1, INT64_MIN, INT64_MAX, UINT64_MAX, std::uint64_t{1} << 63, true, false}},
        {"reals", Array{0.1, 1.0 / 3, 1e300, 5e-324, DBL_MAX, -1e21, INFINITY}},
        {"dates", Array{Date{0}, Date{-62135596800.0}, Date{253402300799.0}, Date{4e9}, Date{-1}}},
        {"data", Array{Data(), Data(std::string("\0\xFF\x80", 3)), Data(std::string(500, 'x'))}},
        {"text", Array{"", " ", "\n", "\xC3\xBC\xF0\x9F\x98\x80"}},
        {"empty", Array{Array(), Dictionary()}},
    };
    auto text = writeXmlPropertyList(value);
    ASSERT_TRUE(text);
    auto back = parsePropertyList(*text);
    ASSERT_TRUE(back) << back.error().text << *text;
    EXPECT_EQ(describe(*back), describe(value));
    EXPECT_EQ(*back, value);
    EXPECT_EQ(*writeXmlPropertyList(*back), *text);

    auto date = parsePropertyList(*writeXmlPropertyList(Date{-0.5}));
    EXPECT_EQ(*date, Value(Date{-1}));
    auto nan = parsePropertyList(*writeXmlPropertyList(std::nan("")));
    EXPECT_TRUE(nan && std::isnan(nan->real().value_or(0)));
}

TEST(PropertyList, TheProgramsLocaleDoesNotChangeReals) {
    std::string before = std::setlocale(LC_ALL, nullptr);
    bool comma = std::setlocale(LC_ALL, "de_DE.UTF-8") != nullptr;
    auto text = writeXmlPropertyList(1.5);
    auto value = parsePropertyList(xml("<real>2.5</real>"));
    std::setlocale(LC_ALL, before.c_str());
    if (!comma) GTEST_SKIP() << "no locale with a decimal comma here";
    EXPECT_EQ(*parsePropertyList(*text), Value(1.5));
    EXPECT_EQ(*value, Value(2.5));
}

TEST(PropertyList, OnlyPropertyListsAreWritten) {
    EXPECT_FALSE(writeXmlPropertyList(Uuid()));
    EXPECT_FALSE(writeXmlPropertyList(Array{"\x01"}));
    EXPECT_FALSE(writeXmlPropertyList(Array(std::vector<Value>(kMaxPropertyListObjects, true))));

    Value value = Array{std::string(100, '&'), Data(std::string(100, 'x'))};
    std::size_t size = writeXmlPropertyList(value)->size();
    EXPECT_TRUE(writeXmlPropertyList(value, size));
    EXPECT_FALSE(writeXmlPropertyList(value, size - 1));
    EXPECT_FALSE(writeXmlPropertyList(Data(std::string(kMaxPropertyListFile, 'x'))));
}

/// Keys that are all in one bucket of libplist's tables.
std::vector<std::string> collidingKeys(int count) {
    std::vector<std::string> keys;
    for (int i = 0; i < count; ++i) {
        keys.emplace_back();
        for (int bit = 0; bit < 14; ++bit) keys.back() += i >> bit & 1 ? "bA" : "ab";
    }
    return keys;
}

TEST(PropertyList, WorkThatGrowsWithTheSquareIsBounded) {
    std::vector<std::string> ordinary;
    for (int i = 0; i < 50'000; ++i)
        ordinary.push_back("org.example.plug-in" + std::to_string(i) + ".extension");
    auto escaped = ordinary;
    for (auto& key : escaped) key += '&';
    struct Case {
        std::vector<std::string> keys;
        bool isRead;
    };
    for (const auto& [keys, isRead] : {Case{ordinary, true}, Case{collidingKeys(3000), true},
                                       Case{collidingKeys(16'000), false}, Case{escaped, false}}) {
        std::vector<Dictionary::Entry> entries;
        std::string text;
        for (const auto& key : keys) {
            entries.emplace_back(key, true);
            text += "<key>" + key + (key.back() == '&' ? "amp;" : "") + "</key><true/>";
        }
        Value value = *Dictionary::fromEntries(std::move(entries));
        auto back = parsePropertyList(xml("<dict>" + text + "</dict>"));
        EXPECT_EQ(bool(back), isRead) << keys[0];
        EXPECT_EQ(bool(writeXmlPropertyList(value)), isRead) << keys[0];
        EXPECT_TRUE(!back || *back == value);
    }
    for (int references : {25'000, 100'000}) {
        bool isRead = references == 25'000;
        auto text = repeated("&amp;", references);
        EXPECT_EQ(bool(parsePropertyList(xml("<string>" + text + "</string>"))), isRead);
        EXPECT_EQ(bool(parsePropertyList(xml("<dict><key>" + text + "</key><true/></dict>"))),
                  isRead);
        EXPECT_EQ(bool(writeXmlPropertyList(std::string(references, '&'))), isRead);
    }
    EXPECT_FALSE(
        parsePropertyList(xml("<dict>" + repeated("<key>a</key><true/>", 300) + "</dict>")));
}

TEST(PropertyList, ReadsBinaryScalarsExactly) {
    struct Case {
        std::string object;
        Value value;
    };
    for (const auto& [object, value] : {
             Case{BYTES("\x10\xFF"), 255},
             Case{BYTES("\x13\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFE"), -2},
             Case{BYTES("\x14\0\0\0\0\0\0\0\0\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF"), UINT64_MAX},
             Case{BYTES("\x22\x3F\xC0\0\0"), 1.5},
             Case{BYTES("\x33\xBF\xE0\0\0\0\0\0\0"), Date{978307199.5}},
             Case{BYTES("\x33\x42\x1D\xCD\x65\0\0\0\0"), Date{32978307200}},
             Case{BYTES("\x62\0\xFC\x20\xAC"), "\xC3\xBC\xE2\x82\xAC"},
             Case{BYTES("\x62\xD8\x3D\xDE\0"), "\xF0\x9F\x98\x80"},
             Case{BYTES("\x50"), ""},
             Case{BYTES("\x42\0\1"), Data(std::string("\0\1", 2))},
         }) {
        auto back = parsePropertyList(binary({object}));
        ASSERT_TRUE(back) << back.error().text << describe(value);
        EXPECT_EQ(*back, value) << describe(*back) << " / " << describe(value);
    }
    // Dates come from elsewhere than the rest: each has to find its place.
    Value dates =
        Array{Dictionary{{"a", Date{978307201}}, {"b", Date{978307200.25}}}, Date{978307201}};
    EXPECT_EQ(*parsePropertyList(
                  binary({BYTES("\xA2\0\1\0\5"), BYTES("\xD2\0\2\0\3\0\4\0\5"),
                          BYTES("\x51"
                                "b"),
                          BYTES("\x51"
                                "a"),
                          BYTES("\x33\x3F\xD0\0\0\0\0\0\0"), BYTES("\x33\x3F\xF0\0\0\0\0\0\0")})),
              dates);
    auto shared =
        parsePropertyList(binary({BYTES("\xA2\0\1\0\1"), BYTES("\xD1\0\2\0\2"), BYTES("\x51k")}));
    ASSERT_TRUE(shared);
    EXPECT_EQ(*shared, (Array{Dictionary{{"k", "k"}}, Dictionary{{"k", "k"}}}));
}

TEST(PropertyList, RefusesBadBinaryLists) {
    std::vector<std::string> refused = {
        "bplist00",
        binary({}),
        binary({BYTES("\0")}),
        binary({BYTES("\x0F")}),
        binary({BYTES("\x80\5")}),
        binary({BYTES("\xC0")}),
        binary({BYTES("\x14\0\0\0\0\0\0\0\1\0\0\0\0\0\0\0\0")}),
        binary({BYTES("\x15")}),
        binary({BYTES("\x53"
                      "a\0b")}),
        binary({BYTES("\x61\0\0")}),
        binary({BYTES("\x61\xD8\0")}),
        binary({BYTES("\x62\xD8\0\0a")}),
        binary({BYTES("\x61\xDC\0")}),
        binary({BYTES("\x51\xFF")}),
        binary({BYTES("\x33\x7F\xF0\0\0\0\0\0\0")}),
        binary({BYTES("\x5F\x13\xFF\xFF\xFF\xFF\xFF\xFF\xFF\xFF")}),
        binary({BYTES("\xAF\x13\x80\0\0\0\0\0\0\0")}),
        binary({BYTES("\xDF\x13\x7F\xFF\xFF\xFF\xFF\xFF\xFF\xFF")}),
        binary({BYTES("\xA1\0\0")}),
        binary({BYTES("\xA1\0\5")}),
        binary({BYTES("\xD1\0\1\0\1"), BYTES("\x09")}),
        binary({BYTES("\xD2\0\1\0\1\0\1\0\1"), BYTES("\x51k")}),
    };
    for (std::size_t i = 0; i < refused.size(); ++i) {
        auto value = parsePropertyList(refused[i]);
        EXPECT_FALSE(value) << i << " is " << describe(*value);
    }
    std::string good = binary({BYTES("\xA1\0\1"), BYTES("\x51k")});
    for (std::size_t i = 0; i < good.size(); ++i) {
        EXPECT_FALSE(parsePropertyList(good.substr(0, i))) << i;
        for (char byte : {'\0', '\x7F', '\xFF'}) {
            std::string changed = good;
            changed[i] = byte;
            (void)parsePropertyList(changed);  // must only not crash
        }
    }
}

TEST(PropertyList, RefusesBinaryListsThatExpandOrNestWithoutEnd) {
    std::vector<std::string> doubling;
    std::vector<std::string> deep;
    for (char i = 0; i < 40; ++i) {
        doubling.push_back(BYTES("\xA2\0") + static_cast<char>(i + 1) + '\0' +
                           static_cast<char>(i + 1));
    }
    doubling.push_back("\x09");
    for (int i = 1; i <= 20'000; ++i)
        deep.push_back({'\xA1', static_cast<char>(i >> 8), static_cast<char>(i)});
    deep.push_back("\x09");
    EXPECT_FALSE(parsePropertyList(binary(doubling)));
    EXPECT_FALSE(parsePropertyList(binary(deep)));
    // 20 000 uses of one string of 20 000 bytes.
    std::string uses = BYTES("\xAF\x11\x4E\x20") + repeated(BYTES("\0\1"), 20'000);
    std::string text = BYTES("\x5F\x11\x4E\x20") + std::string(20'000, 'x');
    EXPECT_FALSE(parsePropertyList(binary({uses, text})));
}

TEST(PropertyList, RefusesBadXml) {
    EXPECT_EQ(*parsePropertyList("\xEF\xBB\xBF" + xml("<true/>") + "<!-- end --> \n"), Value(true));
    EXPECT_EQ(*parsePropertyList(
                  xml("<array><!-- <dict> --><string><![CDATA[</array>]]></string></array>")),
              Value(Array{"</array>"}));
    std::string whole = xml("<dict><key>a</key><string>b</string></dict>");
    for (std::size_t i = 0; i + 1 < whole.size(); ++i)
        EXPECT_FALSE(parsePropertyList(whole.substr(0, i))) << i;
    for (const std::string& text : {
             whole + "garbage",
             whole + whole,
             std::string("{\"a\": 1}"),
             std::string("<dict/>"),
             xml(""),
             xml("<null/>"),
             xml("<uid>3</uid>"),
             xml("<array><true/></dict>"),
             xml("<string>\xFF</string>"),
             xml("<string>&#xD800;</string>"),
             xml("<string>&#0;</string>"),
             xml(BYTES("<string>a\0b</string>")),
             xml("<string>&custom;</string>"),
             xml("<dict><key>\xC3</key><true/></dict>"),
             xml("<array><?php x ?></array>"),
             std::string("<!DOCTYPE plist [<!ENTITY a \"b\">]><plist><true/></plist>"),
         }) {
        auto value = parsePropertyList(text);
        EXPECT_FALSE(value) << text << " is " << describe(*value);
    }
}

TEST(PropertyList, RefusesXmlThatTheParserWouldReadAsSomethingElse) {
    std::istringstream items(
        "<integer>abc</integer>|<integer>7x</integer>|<integer/>|<integer>010</integer>|"
        "<integer>- 1</integer>|<integer>-9223372036854775809</integer>|"
        "<integer>18446744073709551616</integer>|<integer>1<!-- -->2</integer>|<real>x</real>|"
        "<real>+-1</real>|<real>1,5</real>|<real>1e999</real>|<date>rubbish</date>|"
        "<date>2001-02-29T00:00:00Z</date>|<date>2001-257-01T00:00:00Z</date>|"
        "<date>2001-01-01T00:00:00</date>|<date>2001-01-01T00:00:00Z0</date>|<data>!!?</data>|"
        "<data>AAA</data>|<data>AA=A</data>|<data>====</data>|<true>x</true>|"
        "<string>a</strings>|<string>a<b/></string>|<array>text</array>|"
        "<array><key>a</key></array>|<key>a</key>|<dict><key>a</key></dict>|"
        "<dict><key>a</key><key>b</key><true/></dict>|<dict><key>a</key><true/><true/></dict>|"
        "<dict><key>a</key><true/><key>a</key><true/></dict>|"
        "<dict><key>a</key><true/><key>&#97;</key><true/></dict>|<true/><true/>|"
        "<plist><true/></plist>|</plist><plist><true/>");
    for (std::string text; std::getline(items, text, '|');) {
        auto value = parsePropertyList(xml(text));
        EXPECT_FALSE(value) << text << " is " << describe(*value);
    }
    auto value = parsePropertyList(
        xml("<array><integer> -0x1F\n</integer><integer>+5</integer><integer>-0</integer>"
            "<real> +infinity </real><real>-1.5E3</real><date> 2000-02-29T23:59:59Z </date>"
            "<data>\n A A\n= =</data><data/><true> </true ><string/></array>"));
    ASSERT_TRUE(value) << value.error().text;
    EXPECT_EQ(*value, (Array{-31, 5, 0, INFINITY, -1500.0, Date{951868799},
                             Data(std::string(1, '\0')), Data(), true, ""}));
}

TEST(PropertyList, RefusesDeepXmlHoweverItIsHidden) {
    auto nested = [](int depth, const std::string& between) {
        return xml(repeated("<array>" + between, depth) + repeated("</array>", depth));
    };
    EXPECT_TRUE(parsePropertyList(nested(kMaxPropertyListFileDepth, "")));
    EXPECT_FALSE(parsePropertyList(nested(kMaxPropertyListFileDepth + 1, "")));
    for (const char* disguise :
         {"", "<!--</array>-->", "<string><![CDATA[</array>]]></string>", "<plist x=\"</array>\">",
          "<?x </array>?>", "<true x=\"><!--\"/>"}) {
        EXPECT_FALSE(parsePropertyList(nested(100'000, disguise))) << disguise;
    }
    std::string skipped = "<?x \"?>\" <!-- ?>";
    EXPECT_FALSE(parsePropertyList(skipped + nested(100'000, "")));
    EXPECT_FALSE(parsePropertyList(
        xml("<array>" + repeated("<true/>", kMaxPropertyListObjects) + "</array>")));
}

TEST(PropertyList, ErrorsNameTheFile) {
    std::string path = testing::TempDir() + "bad.plist";
    std::ofstream(path) << "nonsense";
    auto value = readPropertyListFile(path);
    ASSERT_FALSE(value);
    EXPECT_EQ(value.error().domain, "PropertyList");
    EXPECT_NE(value.error().text.find(path), std::string::npos);
    EXPECT_EQ(readPropertyListFile(path, 7).error().code, EFBIG);
    EXPECT_EQ(readPropertyListFile(path + ".absent").error().code, ENOENT);
}

}  // namespace
}  // namespace platform
