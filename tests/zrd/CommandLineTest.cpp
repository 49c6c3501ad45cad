#include "zrd/CommandLine.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <vector>

#include "tests/Zorvan/LogLines.h"

namespace zorvan {

namespace {

using testing::ElementsAre;

std::optional<CommandLine> parse(std::vector<std::string> arguments) {
    std::vector<char*> argv{const_cast<char*>("zrd")};
    for (std::string& argument : arguments) argv.push_back(argument.data());
    argv.push_back(nullptr);
    return CommandLine::parse(static_cast<int>(argv.size()) - 1, argv.data());
}

TEST(CommandLineTest, DefaultsAndOverrides) {
    auto line = parse({});
    EXPECT_EQ(line->serviceName, "com.orbel.zorvan.zrd");
    EXPECT_EQ(line->databasePath, std::nullopt);
    EXPECT_EQ(line->cacheLimit, 1000000u);
    LogLines log;
    line = parse({"-S", "a", "-v", "-d/db", "-S", "b", "-v"});
    EXPECT_EQ(line->serviceName, "b");
    EXPECT_EQ(line->databasePath, "/db");
    EXPECT_EQ(line->verbose, 2u);
    const std::string ineffective =
        "default E: verbose option -v is ineffective; use log config --subsystem com.orbel.zorvan";
    EXPECT_THAT(log.take(), ElementsAre(ineffective, ineffective));
}

TEST(CommandLineTest, CacheLimitsAreWhateverNumberTheTextStartsWith) {
    const std::pair<const char*, std::uint32_t> cases[] = {
        {"12abc", 12}, {"abc", 0}, {" +7", 7}, {"", 0}, {"-1", UINT32_MAX}};
    for (const auto& [text, limit] : cases) EXPECT_EQ(parse({"-c", text})->cacheLimit, limit);
}

}  // namespace

}  // namespace zorvan
