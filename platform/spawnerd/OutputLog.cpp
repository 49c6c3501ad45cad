#include "platform/spawnerd/OutputLog.h"

#include <unistd.h>

#include <cerrno>
#include <utility>

#include "platform/log/OpsLog.h"

namespace platform::spawnerd {

OutputLog::OutputLog(RunLoop& loop, UniqueFd pipe, std::string name)
    : pipe_(std::move(pipe)), name_(std::move(name)) {
    watch_.emplace(loop, pipe_.get());
    await();
}

void OutputLog::await() {
    watch_->awaitReadable([this] {
        if (readOn()) return await();
        watch_.reset();
        pipe_.reset();
    });
}

bool OutputLog::readOn() {
    char buffer[4096];
    const ssize_t count = ::read(pipe_.get(), buffer, sizeof buffer);
    if (count > 0) take(buffer, static_cast<std::size_t>(count));
    if (count < 0) return errno == EAGAIN || errno == EINTR;
    if (isFull()) EVLOG_INFO(ops(), "plug-in {} writes more than is logged", pub(name_));
    return count > 0 && !isFull();
}

void OutputLog::take(const char* bytes, std::size_t count) {
    for (std::size_t i = 0; i < count && !isFull(); ++i) {
        ++logged_;
        if (bytes[i] != '\n') line_.push_back(bytes[i]);
        if (bytes[i] == '\n' || line_.size() == kMaxLine || logged_ == kMaxLogged) endLine();
    }
}

void OutputLog::endLine() {
    if (line_.empty()) return;
    EVLOG_INFO(ops(), "plug-in {} writes: {}", pub(name_), line_);
    ++lines_;
    line_.clear();
}

void OutputLog::finish() {
    if (!pipe_) return;
    char buffer[4096];
    ssize_t count = 0;
    for (int i = 0; i < 16 && (count = ::read(pipe_.get(), buffer, sizeof buffer)) > 0; ++i)
        take(buffer, static_cast<std::size_t>(count));
    endLine();
    watch_.reset();
    pipe_.reset();
}

}  // namespace platform::spawnerd
