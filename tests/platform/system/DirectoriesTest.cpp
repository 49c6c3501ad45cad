#include "platform/system/Directories.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <map>
#include <optional>

namespace platform {
namespace {

/// The environment variables that count, set as told; restored at the end.
class Environment {
  public:
    explicit Environment(const std::map<std::string, std::string>& values) {
        for (const char* name : {"HOME", "XDG_RUNTIME_DIR", "XDG_DATA_HOME", "XDG_DATA_DIRS",
                                 "XDG_CONFIG_HOME", "XDG_STATE_HOME"}) {
            const char* old = ::getenv(name);
            saved_[name] = old ? std::optional<std::string>(old) : std::nullopt;
            const auto value = values.find(name);
            set(name, value != values.end() ? std::optional(value->second) : std::nullopt);
        }
    }
    ~Environment() {
        for (const auto& [name, value] : saved_) set(name, value);
    }

  private:
    static void set(const std::string& name, const std::optional<std::string>& value) {
        if (value)
            ::setenv(name.c_str(), value->c_str(), 1);
        else
            ::unsetenv(name.c_str());
    }
    std::map<std::string, std::optional<std::string>> saved_;
};

TEST(Directories, ComeFromTheEnvironmentWithDefaults) {
    {
        const Environment environment({{"HOME", "/h/"}, {"XDG_DATA_DIRS", "relative::"}});
        const Directories directories = Directories::fromEnvironment();
        EXPECT_EQ(directories.runtime, "/run/user/" + std::to_string(::getuid()));
        EXPECT_EQ(directories.dataHome, "/h/.local/share");
        EXPECT_EQ(directories.dataDirs,
                  (std::vector<std::string>{"/usr/local/share", "/usr/share"}));
        EXPECT_EQ(directories.configHome, "/h/.config");
        EXPECT_EQ(directories.stateHome, "/h/.local/state");
    }
    const Environment environment({{"XDG_RUNTIME_DIR", "/r"},
                                   {"XDG_DATA_HOME", "/d/"},
                                   {"XDG_DATA_DIRS", "/a:not/absolute:/b/"},
                                   {"XDG_CONFIG_HOME", "relative"},
                                   {"XDG_STATE_HOME", "/s"}});
    const Directories directories = Directories::fromEnvironment();
    EXPECT_EQ(directories.zorvanRuntime(), "/r/zorvan");
    EXPECT_EQ(directories.zorvanData(), "/d/zorvan");
    EXPECT_EQ(directories.dataDirs, (std::vector<std::string>{"/a", "/b"}));
    EXPECT_TRUE(directories.configHome.ends_with("/.config") && directories.configHome[0] == '/');
    EXPECT_EQ(directories.stateHome, "/s");
}

TEST(UserConfstr, TruncatesAndAnswersTheWholeSize) {
    Directories directories;
    directories.stateHome = "/state";
    char buffer[] = "########";
    EXPECT_EQ(userConfstr(directories, kUserDirectory, nullptr, 0), 7u);
    EXPECT_EQ(userConfstr(directories, kUserDirectory, buffer, 4), 7u);
    EXPECT_EQ(std::string(buffer, 5), std::string("/st\0#", 5));
    EXPECT_EQ(userConfstr(directories, kUserDirectory, buffer, 7), 7u);
    EXPECT_EQ(std::string(buffer, 8), std::string("/state\0#", 8));

    EXPECT_EQ(userConfstr(directories, 1, buffer, 8), 0u);
    EXPECT_EQ(errno, EINVAL);
    EXPECT_EQ(userConfstr(Directories(), kUserDirectory, buffer, 8), 0u);
    EXPECT_EQ(errno, ENOENT);
}

}  // namespace
}  // namespace platform
