#include "platform/log/Log.h"

#include <fmt/chrono.h>
#include <fmt/format.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <unistd.h>

#define SD_JOURNAL_SUPPRESS_LOCATION
#include <systemd/sd-journal.h>

#include <cerrno>
#include <charconv>
#include <chrono>
#include <cstdlib>
#include <map>
#include <memory>
#include <mutex>

#include "platform/values/Utf8.h"

namespace platform {

namespace {

constexpr const char* kJournalSocket = "/run/systemd/journal/socket";

/// As many bytes of one text as a line shows.
constexpr std::size_t kMaxText = 64 * 1024;

constexpr std::string_view kLevelNames[] = {"debug", "info", "default", "error", "off"};
/// Priorities of syslog, by the level of a message.
constexpr int kPriorities[] = {7, 6, 5, 3};

std::string environment(const char* name) {
    const char* value = std::getenv(name);
    return value ? value : "";
}

/// The service manager names the device and inode of the journal's socket; standard error is the
/// journal only while it still is that socket.
bool standardErrorIsJournal() {
    std::string stream = environment("JOURNAL_STREAM");
    const char* end = stream.data() + stream.size();
    dev_t device = 0;
    ino_t inode = 0;
    auto first = std::from_chars(stream.data(), end, device);
    if (first.ec != std::errc() || first.ptr == end || *first.ptr != ':') return false;
    auto second = std::from_chars(first.ptr + 1, end, inode);
    if (second.ec != std::errc() || second.ptr != end) return false;
    struct stat status {};
    return ::fstat(STDERR_FILENO, &status) == 0 && status.st_dev == device &&
           status.st_ino == inode;
}

/// Where lines go, decided once at the first use of the log.
struct Destination {
    bool journal = standardErrorIsJournal();
    /// In a container the journal may be the standard error and yet out of reach, where sending
    /// "succeeds" all the same.
    bool takesFields = journal && ::access(kJournalSocket, W_OK) == 0;
    bool hidesPrivate = journal && environment("ZR_LOG_PRIVATE") != "1";
};

const Destination& destination() {
    static const Destination destination;
    return destination;
}

/// All handles, and the capture that listens to them. Never destroyed: objects that log while the
/// process exits still need them.
struct Handles {
    const std::string setting = environment("ZR_LOG");
    std::mutex mutex;  // guards `byName`, changes of the handles' levels, and `capturing`
    std::map<std::pair<std::string, std::string>, std::unique_ptr<Log>> byName;
    bool capturing = false;
    std::atomic<bool> hidesFromCapture = false;

    std::mutex captureMutex;  // guards `sink`; held while it runs. Never taken under `mutex`
    LogCapture::Sink sink;
};

Handles& handles() {
    static auto* const handles = new Handles;
    return *handles;
}

bool sendToJournal(const std::string& subsystem, const std::string& category, LogLevel level,
                   const std::string& text) {
    std::string fields[] = {
        "MESSAGE=" + text,
        fmt::format("PRIORITY={}", kPriorities[static_cast<int>(level)]),
        "CATEGORY=" + category,
        "SUBSYSTEM=" + subsystem,
    };
    iovec vectors[std::size(fields)];
    for (std::size_t i = 0; i < std::size(fields); ++i)
        vectors[i] = {fields[i].data(), fields[i].size()};
    int count = static_cast<int>(std::size(fields)) - (subsystem.empty() ? 1 : 0);
    return ::sd_journal_sendv(vectors, count) >= 0;
}

/// One write, so that lines of several threads and processes do not mix.
void writeToStandardError(const std::string& category, LogLevel level, const std::string& text) {
    using namespace std::chrono;
    auto now = system_clock::now();
    std::time_t seconds = system_clock::to_time_t(floor<std::chrono::seconds>(now));
    auto milliseconds = duration_cast<std::chrono::milliseconds>(now.time_since_epoch()).count();
    std::tm local{};
    ::localtime_r(&seconds, &local);
    std::string line =
        fmt::format("{:%Y-%m-%d %H:%M:%S}.{:03} {} {} {}\n", local, milliseconds % 1000, category,
                    kLevelNames[static_cast<int>(level)], text);
    std::string_view rest = line;
    while (!rest.empty()) {
        ssize_t count = ::write(STDERR_FILENO, rest.data(), rest.size());
        if (count < 0 && errno == EINTR) continue;
        if (count < 0) return;
        rest.remove_prefix(static_cast<std::size_t>(count));
    }
}

}  // namespace

namespace detail {

std::string escaped(std::string_view text) {
    if (text.size() > kMaxText) return escaped(text.substr(0, kMaxText)) + "...";
    std::string result;
    result.reserve(text.size());
    std::size_t valid = validUtf8Prefix(text);
    bool inHighControl = false;
    for (std::size_t i = 0; i < text.size(); ++i) {
        auto byte = static_cast<unsigned char>(text[i]);
        bool escapes = byte < 0x20 || byte == 0x7F || std::exchange(inHighControl, false);
        if (i == valid) {
            escapes = true;
            valid = i + 1 + validUtf8Prefix(text.substr(i + 1));
        } else if (byte == 0xC2 && static_cast<unsigned char>(text[i + 1]) < 0xA0) {
            // Terminals obey the controls U+0080 to U+009F as well.
            escapes = inHighControl = true;
        }
        if (byte == '\n') {
            result += "\\n";
        } else if (escapes) {
            fmt::format_to(std::back_inserter(result), "\\x{:02X}", byte);
        } else {
            result += text[i];
        }
    }
    return result;
}

LogLevel levelInSetting(std::string_view setting, std::string_view category) {
    std::optional<LogLevel> own;
    std::optional<LogLevel> general;
    while (!setting.empty()) {
        std::size_t comma = setting.find(',');
        std::string_view word = setting.substr(0, comma);
        setting.remove_prefix(comma == std::string_view::npos ? setting.size() : comma + 1);
        std::size_t equals = word.find('=');
        std::string_view name = word.substr(equals == std::string_view::npos ? 0 : equals + 1);
        auto& level = equals == std::string_view::npos ? general : own;
        if (equals != std::string_view::npos && word.substr(0, equals) != category) continue;
        for (std::size_t i = 0; i < std::size(kLevelNames); ++i) {
            if (kLevelNames[i] == name) level = static_cast<LogLevel>(i);
        }
    }
    return own.value_or(general.value_or(LogLevel::Default));
}

}  // namespace detail

Log::Log(std::string subsystem, std::string category)
    : subsystem_(std::move(subsystem)),
      category_(std::move(category)),
      level_(LogLevel::Default),
      configured_(detail::levelInSetting(handles().setting, category_)) {
    level_ = handles().capturing ? kCaptured : configured_;
}

const Log& Log::make(const std::string& subsystem, const std::string& category) {
    Handles& all = handles();
    std::lock_guard lock(all.mutex);
    auto& handle = all.byName[{subsystem, category}];
    if (!handle) handle.reset(new Log(subsystem, category));
    return *handle;
}

const Log& Log::defaultHandle() {
    static const Log& handle = make("", "default");
    return handle;
}

const char* Log::privateMask() const {
    const bool hides =
        isCaptured() ? handles().hidesFromCapture.load() : destination().hidesPrivate;
    return hides ? "<private>" : nullptr;
}

void Log::writeLine(LogLevel level, const std::string& text) const {
    if (isCaptured()) {
        Handles& all = handles();
        std::lock_guard lock(all.captureMutex);
        if (all.sink) all.sink(category_, level, text);
    }
    // Only a capture wanted it, perhaps one that has gone meanwhile.
    if (level < configured_) return;
    // A line must not be lost because the journal is away.
    if (destination().takesFields && sendToJournal(subsystem_, category_, level, text)) return;
    writeToStandardError(category_, level, text);
}

LogCapture::LogCapture(Sink sink, Private arguments) {
    Handles& all = handles();
    all.hidesFromCapture = arguments == Private::Hidden;
    {
        std::lock_guard lock(all.captureMutex);
        all.sink = std::move(sink);
    }
    std::lock_guard lock(all.mutex);
    all.capturing = true;
    for (auto& [name, handle] : all.byName) handle->level_ = Log::kCaptured;
}

LogCapture::~LogCapture() {
    Handles& all = handles();
    {
        std::lock_guard lock(all.mutex);
        for (auto& [name, handle] : all.byName) handle->level_ = handle->configured_;
        all.capturing = false;
    }
    // Waits for the sink's last call.
    std::lock_guard lock(all.captureMutex);
    all.sink = nullptr;
}

}  // namespace platform
