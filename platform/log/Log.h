#pragma once

#include <fmt/core.h>

#include <atomic>
#include <concepts>
#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>

namespace platform {

/// Levels of log messages, the most talkative first. A category's level is the first that it
/// writes; unless told otherwise, `Default`. No message has the level `Off`.
enum class LogLevel { Debug, Info, Default, Error, Off };

/// Anything with a `describe` is an object of a log line: its text is written in its place.
template <class T>
concept Describable = requires(const T& object) {
    { describe(object) } -> std::convertible_to<std::string>;
};

/// Marks an argument as public: written in full wherever the log goes. Borrows it for the one call.
template <class T>
struct Public {
    const T& argument;
};
template <class T>
Public<T> pub(const T& argument) {
    return {argument};
}

namespace detail {

/// The text of a string argument for the log: control characters and bytes that are not UTF-8
/// escaped ("\n", else "\xNN"), cut after 64 KiB with "..."; "(null)" for a null pointer.
std::string escaped(std::string_view text);
inline std::string escaped(const char* text) {
    return escaped(text ? std::string_view(text) : std::string_view("(null)"));
}

/// The level that a value of ZR_LOG gives to a category: the one named for it, else the one that
/// stands alone, else `Default`. Words that name no level count for nothing.
LogLevel levelInSetting(std::string_view setting, std::string_view category);

/// Numbers and addresses, which are written in full wherever the log goes.
template <class T>
inline constexpr bool isPlain =
    std::is_arithmetic_v<T> || std::is_same_v<T, const void*> || std::is_same_v<T, void*>;

template <class T>
struct IsOptional : std::false_type {};
template <class T>
struct IsOptional<std::optional<T>> : std::true_type {};

template <class T>
auto shown(const T& argument) {
    if constexpr (isPlain<T>) {
        return argument;
    } else if constexpr (std::is_convertible_v<const T&, const char*>) {
        return escaped(static_cast<const char*>(argument));
    } else if constexpr (std::is_convertible_v<const T&, std::string_view>) {
        return escaped(std::string_view(argument));
    } else if constexpr (std::is_pointer_v<T> || IsOptional<T>::value) {
        return argument ? fmt::format("{}", shown(*argument)) : std::string("(null)");
    } else {
        static_assert(Describable<T>, "a log argument is a number, a string or has describe()");
        return escaped(describe(argument));
    }
}

template <class T>
struct IsPublic : std::false_type {};
template <class T>
struct IsPublic<Public<T>> : std::true_type {};

/// An argument as it is written: where private ones are hidden, `mask` in the place of those.
template <class T>
auto loggable(const T& argument, const char* mask) {
    if constexpr (isPlain<T>) {
        return argument;
    } else if constexpr (IsPublic<T>::value) {
        return shown(argument.argument);
    } else {
        return mask ? std::string(mask) : std::string(shown(argument));
    }
}

}  // namespace detail

/// A log handle: one category of one subsystem. Handles are made once and live as long as the
/// process; every operation may be called from any thread.
///
/// Lines go to the journal, with the fields SUBSYSTEM, CATEGORY and PRIORITY, when standard error
/// is a journal that can be reached; else to standard error with time, category and level.
/// Strings and objects that are not wrapped in `pub` appear as "<private>" in the journal, unless
/// the environment has ZR_LOG_PRIVATE=1. The level of a category comes from ZR_LOG: "debug" for
/// all, or a list like "ops=debug,td=info"; "off" writes nothing. Both variables are read once.
///
/// Write through the macros below: they evaluate nothing while the level is off.
class Log {
  public:
    /// The handle of a category, made at its first use.
    static const Log& make(const std::string& subsystem, const std::string& category);
    /// The handle outside any subsystem; its category is "default".
    static const Log& defaultHandle();

    bool enabled(LogLevel level) const { return level >= level_.load(std::memory_order_relaxed); }

    /// Writes a line; call it through the macros below, which look at the level first.
    template <class... Arguments>
    void write(
        LogLevel level,
        fmt::format_string<decltype(detail::loggable(std::declval<const Arguments&>(), ""))...>
            format,
        const Arguments&... arguments) const {
        [[maybe_unused]] const char* mask = privateMask();
        writeFormatted(level, format, detail::loggable(arguments, mask)...);
    }

    const std::string& category() const { return category_; }

  private:
    Log(std::string subsystem, std::string category);
    Log(const Log&) = delete;
    template <class... Shown>
    void writeFormatted(LogLevel level, fmt::string_view format, const Shown&... shown) const {
        writeLine(level, fmt::vformat(format, fmt::make_format_args(shown...)));
    }
    void writeLine(LogLevel level, const std::string& text) const;
    /// "<private>" where private arguments are hidden (the journal), else null.
    const char* privateMask() const;
    bool isCaptured() const { return level_.load(std::memory_order_relaxed) == kCaptured; }
    friend class LogCapture;

    /// Below all levels: a capture wants every line.
    static constexpr LogLevel kCaptured{-1};

    std::string subsystem_;
    std::string category_;
    mutable std::atomic<LogLevel> level_;
    LogLevel configured_;
};

/// For tests: while it lives, every line of every handle is also given to `sink`, whatever the
/// levels say. At most one at a time. `sink` runs on the writing thread, one call at a time.
class LogCapture {
  public:
    /// What it is given for private arguments: all of them, or "<private>", as the journal is.
    enum class Private { Shown, Hidden };
    using Sink =
        std::function<void(const std::string& category, LogLevel level, const std::string& text)>;
    explicit LogCapture(Sink sink, Private arguments = Private::Shown);
    LogCapture(const LogCapture&) = delete;
    ~LogCapture();
};

}  // namespace platform

/// EVLOG_INFO(ops(), "client {} requested {}", pid, pub(type));
#define EVLOG_AT(level, handle, ...)                                           \
    do {                                                                       \
        const ::platform::Log& evlogHandle = (handle);                         \
        if (evlogHandle.enabled(level)) evlogHandle.write(level, __VA_ARGS__); \
    } while (false)
#define EVLOG_DEBUG(handle, ...) EVLOG_AT(::platform::LogLevel::Debug, handle, __VA_ARGS__)
#define EVLOG_INFO(handle, ...) EVLOG_AT(::platform::LogLevel::Info, handle, __VA_ARGS__)
#define EVLOG_DEFAULT(handle, ...) EVLOG_AT(::platform::LogLevel::Default, handle, __VA_ARGS__)
#define EVLOG_ERROR(handle, ...) EVLOG_AT(::platform::LogLevel::Error, handle, __VA_ARGS__)
