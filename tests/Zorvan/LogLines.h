#pragma once

#include <mutex>
#include <string>
#include <utility>
#include <vector>

#include "platform/log/Log.h"

namespace zorvan {

/// Gathers the log while it lives: "<category> <level>: <text>", levels as D, I, - and E.
class LogLines {
  public:
    using Private = platform::LogCapture::Private;
    explicit LogLines(Private arguments = Private::Shown)
        : capture_([this](const auto&... line) { add(line...); }, arguments) {}

    /// What has been logged since the last call.
    std::vector<std::string> take() {
        std::lock_guard lock(mutex_);
        return std::exchange(lines_, {});
    }

  private:
    void add(const std::string& category, platform::LogLevel level, const std::string& text) {
        std::lock_guard lock(mutex_);
        lines_.push_back(category + ' ' + "DI-E"[static_cast<int>(level)] + ": " + text);
    }

    std::mutex mutex_;  // guards lines_
    std::vector<std::string> lines_;
    platform::LogCapture capture_;
};

}  // namespace zorvan
