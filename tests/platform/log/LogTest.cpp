#include "platform/log/Log.h"

#include <gtest/gtest.h>

#include <algorithm>
#include <thread>
#include <vector>

#include "platform/values/Value.h"

namespace platform {
namespace {

struct Named {
    std::string name;
};
std::string describe(const Named& named) {
    return "<" + named.name + ">";
}

TEST(Log, ACaptureSeesEveryLevel) {
    const Log& log = Log::make("test", "category");
    EXPECT_EQ(&log, &Log::make("test", "category"));
    EXPECT_NE(&log, &Log::make("other", "category"));
    EXPECT_FALSE(log.enabled(LogLevel::Info));

    std::vector<std::string> lines;
    int evaluated = 0;
    auto argument = [&] { return ++evaluated; };
    EVLOG_DEBUG(log, "unseen {}", argument());
    EXPECT_EQ(evaluated, 0);
    const auto sink = [&](const std::string& category, LogLevel level, const std::string& text) {
        lines.push_back(fmt::format("{} {} {}", category, static_cast<int>(level), text));
    };
    const Named named{"n"};
    {
        const LogCapture capture(sink);
        std::optional<Named> none;
        EVLOG_DEBUG(log, "{} {} {}", argument(), std::string("s"), pub("p"));
        EVLOG_INFO(Log::make("test", "later"), "{} {} {} {}", Named{"a\n"}, none, &named, pub(1.5));
        EVLOG_DEBUG(log, "{:x} {} {}", 255u, static_cast<const char*>(nullptr), Value(true));
    }
    EVLOG_DEBUG(log, "unseen {}", argument());
    {
        const LogCapture capture(sink, LogCapture::Private::Hidden);
        EVLOG_ERROR(log, "{} {} {} {}", 1, "s", named, pub(named));
    }
    EXPECT_EQ(lines, (std::vector<std::string>{"category 0 1 s p", "later 1 <a\\n> (null) <n> 1.5",
                                               "category 0 ff (null) true",
                                               "category 3 1 <private> <private> <n>"}));
    EXPECT_EQ(evaluated, 1);
}

TEST(Log, LevelsComeFromTheSetting) {
    using detail::levelInSetting;
    struct Case {
        const char* setting;
        LogLevel ops;
        LogLevel td;
    };
    for (auto [setting, ops, td] : {
             Case{"", LogLevel::Default, LogLevel::Default},
             Case{"debug", LogLevel::Debug, LogLevel::Debug},
             Case{"ops=debug,td=info", LogLevel::Debug, LogLevel::Info},
             Case{"ops=error,info", LogLevel::Error, LogLevel::Info},
             Case{"loud,ops=loud,,=,td=", LogLevel::Default, LogLevel::Default},
             Case{"opsx=debug,op=debug", LogLevel::Default, LogLevel::Default},
         }) {
        EXPECT_EQ(levelInSetting(setting, "ops"), ops) << setting;
        EXPECT_EQ(levelInSetting(setting, "td"), td) << setting;
    }
}

TEST(Log, ArgumentsCannotForgeLinesOrDriveTheTerminal) {
    EXPECT_EQ(detail::escaped(std::string_view("a\n\r\t\0\x1B[31m\x7F", 11)),
              "a\\n\\x0D\\x09\\x00\\x1B[31m\\x7F");
    EXPECT_EQ(detail::escaped("\xC3\xBC \xE2\x82\xAC \xF0\x9F\x98\x80"),
              "\xC3\xBC \xE2\x82\xAC \xF0\x9F\x98\x80");
    EXPECT_EQ(detail::escaped("\xC2\x9B"
                              "a\xC2\xA0"),
              "\\xC2\\x9Ba\xC2\xA0");
    EXPECT_EQ(detail::escaped("\xC3(\xED\xA0\x80\xF4\x90\x80\x80\xE2\x82"),
              "\\xC3(\\xED\\xA0\\x80\\xF4\\x90\\x80\\x80\\xE2\\x82");
    const std::string longest(64 * 1024, 'x');
    EXPECT_EQ(detail::escaped(longest), longest);
    EXPECT_EQ(detail::escaped(longest + "y"), longest + "...");
}

TEST(Log, LinesGoToStandardErrorWholeAndAboveTheLevelOnly) {
    const Log& log = Log::make("test", "stderr");
    testing::internal::CaptureStderr();
    EVLOG_ERROR(log, "failed: {}", "secret");
    EVLOG_INFO(log, "not this");
    std::string output = testing::internal::GetCapturedStderr();
    EXPECT_TRUE(output.ends_with(" stderr error failed: secret\n")) << output;
    EXPECT_EQ(std::ranges::count(output, '\n'), 1);
}

TEST(Log, ThreadsWriteWhileACaptureComesAndGoes) {
    std::atomic<bool> stop = false;
    std::atomic<int> started = 0;
    std::vector<std::jthread> threads;
    for (int i = 0; i < 3; ++i) {
        threads.emplace_back([&, i] {
            const Log& log = Log::make("test", fmt::format("thread{}", i));
            while (!stop) {
                EVLOG_DEBUG(log, "line {}", i);
                ++started;
            }
        });
    }
    for (int round = 0; round < 20; ++round) {
        int lines = 0;  // not atomic: the sink's calls must be ordered
        LogCapture capture([&](const std::string&, LogLevel, const std::string&) { ++lines; });
        int until = started + 50;
        while (started < until) std::this_thread::yield();
    }
    stop = true;
}

}  // namespace
}  // namespace platform
