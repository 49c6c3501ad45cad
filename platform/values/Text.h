#pragma once

#include <compare>
#include <string>
#include <string_view>

#include "platform/values/Memory.h"

namespace platform {

/// Bytes that do not change: a copy of its own, or a slice of memory that it keeps. Copies share
/// them.
class Bytes {
  public:
    Bytes() = default;
    explicit Bytes(std::string_view bytes);
    /// Bytes that lie in the memory.
    Bytes(Hold memory, std::string_view slice)
        : memory_(std::move(memory)), data_(slice.data()), size_(slice.size()) {}
    Bytes(const Bytes&) = default;
    Bytes& operator=(const Bytes&) = default;
    Bytes(Bytes&& other) noexcept
        : memory_(std::move(other.memory_)),
          data_(std::exchange(other.data_, "")),
          size_(std::exchange(other.size_, 0)) {}
    Bytes& operator=(Bytes&& other) noexcept {
        memory_ = std::move(other.memory_);
        data_ = std::exchange(other.data_, "");
        size_ = std::exchange(other.size_, 0);
        return *this;
    }
    ~Bytes() = default;

    std::string_view view() const { return {data_, size_}; }
    Memory* memory() const { return memory_.get(); }

  private:
    Hold memory_;
    const char* data_ = "";
    std::size_t size_ = 0;
};

/// A text, UTF-8 without NUL by convention. Immutable; copies share it. There is no NUL behind it.
class Text {
  public:
    Text() = default;
    Text(std::string_view text) : bytes_(text) {}
    Text(const std::string& text) : bytes_(text) {}
    Text(const char* text) : bytes_(text) {}
    explicit Text(Bytes bytes) : bytes_(std::move(bytes)) {}

    std::string_view view() const { return bytes_.view(); }
    operator std::string_view() const { return view(); }
    std::string string() const { return std::string(view()); }
    std::size_t size() const { return view().size(); }
    bool empty() const { return view().empty(); }

    bool operator==(const Text& other) const { return view() == other.view(); }
    bool operator==(std::string_view other) const { return view() == other; }
    bool operator==(const std::string& other) const { return view() == other; }
    bool operator==(const char* other) const { return view() == other; }
    auto operator<=>(const Text& other) const { return view() <=> other.view(); }

  private:
    Bytes bytes_;
};

/// A string of bytes. Immutable; copies share it.
class Data {
  public:
    Data() = default;
    explicit Data(std::string_view bytes) : bytes_(bytes) {}
    explicit Data(Bytes bytes) : bytes_(std::move(bytes)) {}

    std::string_view bytes() const { return bytes_.view(); }
    bool operator==(const Data& other) const { return bytes() == other.bytes(); }

  private:
    Bytes bytes_;
};

}  // namespace platform
