#pragma once

#include <fmt/core.h>

#include <exception>
#include <optional>
#include <string>
#include <string_view>
#include <utility>

namespace zorvan {

/// The domain of this system's own errors.
inline constexpr const char* kZRErrorDomain = "Zorvan";

/// Codes of the "Zorvan" domain. Hosts see them in replies, so they never change.
enum ZRErrorCode : int {
    kZRErrorRegistration = 2,
    kZRErrorInvalidRequest = 4,
    kZRErrorInterfaceSpecification = 6,
    kZRErrorVersion = 7,
    kZRErrorPath = 9,
    kZRErrorDenied = 11,
    kZRErrorPlugIn = 12,
    kZRErrorBusy = 14,
    kZRErrorAnnotation = 18,
};

/// An error: a code of a domain and, if there is one, a description for people. A plain value.
struct ZRError {
    std::string domain;
    int code = 0;
    std::optional<std::string> description;

    bool operator==(const ZRError&) const = default;
};

/// "<description> (<domain> <code>)"
std::string describe(const ZRError& error);

/// An error of the "Zorvan" domain.
ZRError ZRErrorWithCode(int code, std::optional<std::string> description = std::nullopt);

/// The same with a formatted description.
template <class... Arguments>
ZRError ZRErrorWithFormat(int code, fmt::format_string<Arguments...> format,
                          Arguments&&... arguments) {
    return ZRErrorWithCode(code, fmt::format(format, std::forward<Arguments>(arguments)...));
}

/// A broken invariant of the program itself: thrown where it is seen, after an error line, and
/// caught by nobody in the daemon, which then aborts.
class ZRInternalInconsistency : public std::exception {
  public:
    ZRInternalInconsistency(std::string method, std::string file, int line, std::string text);
    const char* what() const noexcept override { return what_.c_str(); }
    const std::string& text() const { return text_; }

  private:
    std::string text_;
    std::string what_;
};

/// Logs the inconsistency at error level on "ops" and throws it.
[[noreturn]] void reportInternalInconsistency(const char* method, const char* file, int line,
                                              const std::string& text);

}  // namespace zorvan

#define ZR_INTERNAL_INCONSISTENCY(text) \
    ::zorvan::reportInternalInconsistency(__func__, __FILE__, __LINE__, (text))
