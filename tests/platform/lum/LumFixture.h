#pragma once

#include <gtest/gtest.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <chrono>
#include <cstring>
#include <filesystem>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/log/Log.h"
#include "platform/lum/Frame.h"
#include "platform/lum/Limits.h"
#include "platform/lum/Listener.h"
#include "platform/system/Directories.h"
#include "platform/system/UniqueFd.h"
#include "platform/threads/RunLoop.h"
#include "platform/threads/SerialQueue.h"

namespace platform::lum {

/// A loop that the test steps, a runtime directory of its own, and the error lines written.
class LumTest : public ::testing::Test {
  protected:
    LumTest() {
        std::string pattern = (std::filesystem::temp_directory_path() / "lum-XXXXXX").string();
        directories.runtime = mkdtemp(pattern.data());
    }
    ~LumTest() override { std::filesystem::remove_all(directories.runtime); }

    std::string path(const std::string& service = "test") {
        return *socketPath(directories, service);
    }

    /// Steps the loop until `condition` holds; fails after a while.
    template <class Condition>
    bool stepUntil(Condition condition) {
        const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
        while (!condition()) {
            if (std::chrono::steady_clock::now() > deadline) return false;
            loop.runOnce(std::chrono::milliseconds(10));
        }
        return true;
    }

    std::size_t errorLines(const std::string& part = "") {
        std::lock_guard lock(mutex_);
        std::size_t count = 0;
        for (const std::string& line : errors_) count += line.find(part) != std::string::npos;
        return count;
    }

    Directories directories;
    RunLoop loop;
    SerialQueue queue{"lum", loop};

  private:
    std::mutex mutex_;
    std::vector<std::string> errors_;
    LogCapture capture_{
        [this](const std::string& category, LogLevel level, const std::string& text) {
            std::lock_guard lock(mutex_);
            if (level == LogLevel::Error && category == "ops") errors_.push_back(text);
        }};
};

inline UniqueFd unixSocket(const std::string& path, int (*use)(int, const sockaddr*, socklen_t)) {
    UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address{};
    address.sun_family = AF_UNIX;
    std::strcpy(address.sun_path, path.c_str());
    if (use(socket.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0)
        socket.reset();
    return socket;
}

inline std::string requestFrame(std::uint64_t serial, Dictionary body = {}) {
    Message message(std::move(body));
    message.setSerial(serial);
    return encodeFrame(FrameKind::Request, message, kMaxRequestPayload)->string();
}

/// A peer that writes bytes as it likes; reads never block.
class RawPeer {
  public:
    explicit RawPeer(UniqueFd connected) : socket_(std::move(connected)) {}
    explicit RawPeer(const std::string& path) : RawPeer(unixSocket(path, ::connect)) {}

    int fd() const { return socket_.get(); }
    /// Sends what the socket takes.
    std::size_t write(std::string_view bytes) {
        const ssize_t count = ::send(fd(), bytes.data(), bytes.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
        return count < 0 ? 0 : static_cast<std::size_t>(count);
    }
    void halfClose() { ::shutdown(fd(), SHUT_WR); }
    void close() { socket_.reset(); }

    /// The next message of the kind expected, once it is there whole.
    std::optional<Message> read(FrameKind kind = FrameKind::Reply) {
        while (true) {
            auto payload = reader_.take(input_);
            if (payload && *payload) return std::get<Message>(decodePayload(*payload, kind));
            const ssize_t count = ::recv(fd(), buffer_, sizeof buffer_, MSG_DONTWAIT);
            if (count <= 0) return std::nullopt;
            input_ = {buffer_, static_cast<std::size_t>(count)};
        }
    }
    /// Whether the other side has closed; drops what it sent before.
    bool hasEnded() {
        ssize_t count = 1;
        while (count > 0) count = ::recv(fd(), buffer_, sizeof buffer_, MSG_DONTWAIT);
        return count == 0 || errno != EAGAIN;
    }

  private:
    UniqueFd socket_;
    FrameReader reader_{kMaxReplyPayload};
    char buffer_[64 * 1024];
    std::string_view input_;
};

}  // namespace platform::lum
