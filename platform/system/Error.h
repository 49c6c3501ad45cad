#pragma once

#include <string>
#include <string_view>
#include <utility>
#include <variant>

namespace platform {

/// Why an operation of this layer failed. `domain` says whose `code` it is: "POSIX" (an errno),
/// "PropertyList", "Cbor", "SQLite". `text` is for people and names the file or peer where there is
/// one.
struct Error {
    std::string domain;
    int code = 0;
    std::string text;

    /// A failed system call: the domain "POSIX" and the text "<what>: <the system's text for the
    /// errno>".
    static Error posix(int errnum, std::string_view what);
};

std::string describe(const Error& error);

/// Whether there was no such file.
bool isMissingFile(const Error& error);

/// Whether the same may succeed later with nothing changed on disk: out of descriptors or memory,
/// or the device failed.
bool isTransient(const Error& error);

/// A value, or the error that kept it from being made.
template <class T>
class [[nodiscard]] Result {
  public:
    Result(T value) : outcome_(std::in_place_index<0>, std::move(value)) {}
    Result(Error error) : outcome_(std::in_place_index<1>, std::move(error)) {}

    explicit operator bool() const { return outcome_.index() == 0; }
    /// Only when there is a value.
    T& operator*() { return *std::get_if<0>(&outcome_); }
    const T& operator*() const { return *std::get_if<0>(&outcome_); }
    T* operator->() { return std::get_if<0>(&outcome_); }
    const T* operator->() const { return std::get_if<0>(&outcome_); }
    /// Only when there is none.
    const Error& error() const { return *std::get_if<1>(&outcome_); }

  private:
    std::variant<T, Error> outcome_;
};

}  // namespace platform
