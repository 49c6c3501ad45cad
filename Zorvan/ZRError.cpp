#include "Zorvan/ZRError.h"

#include "Zorvan/LogHandles.h"

namespace zorvan {

std::string describe(const ZRError& error) {
    std::string origin = fmt::format("{} {}", error.domain, error.code);
    if (!error.description) return origin;
    return fmt::format("{} ({})", *error.description, origin);
}

ZRError ZRErrorWithCode(int code, std::optional<std::string> description) {
    return {kZRErrorDomain, code, std::move(description)};
}

ZRInternalInconsistency::ZRInternalInconsistency(std::string method, std::string file, int line,
                                                 std::string text)
    : text_(std::move(text)), what_(fmt::format("{} ({}:{}): {}", method, file, line, text_)) {}

void reportInternalInconsistency(const char* method, const char* file, int line,
                                 const std::string& text) {
    ZRInternalInconsistency inconsistency(method, file, line, text);
    EVLOG_ERROR(ops(), "internal inconsistency in {}", pub(inconsistency.what()));
    throw inconsistency;
}

}  // namespace zorvan
