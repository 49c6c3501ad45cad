#include "Zorvan/ZRProtocols.h"

#include <fmt/format.h>

#include <cstdlib>
#include <string_view>
#include <vector>

#include "Zorvan/LogHandles.h"

namespace zorvan {

using platform::ObjectInterface;
using platform::ObjectRuntime;
using platform::ProtocolRef;

namespace {

void report(std::optional<ZRError>* error, const std::string& text) {
    if (error) *error = ZRErrorWithCode(kZRErrorPlugIn, text);
}

std::vector<std::string> split(std::string_view text, char separator) {
    std::vector<std::string> parts;
    for (;;) {
        const std::size_t end = text.find(separator);
        parts.emplace_back(text.substr(0, end));
        if (end == std::string_view::npos) return parts;
        text.remove_prefix(end + 1);
    }
}

/// What a field's digits say, after white space and a sign; 0 without any.
std::size_t decimalValue(const std::string& text) {
    return static_cast<std::size_t>(std::strtol(text.c_str(), nullptr, 10));
}

ZRError wrong(const std::string& what) {
    return ZRErrorWithCode(kZRErrorInterfaceSpecification, what);
}

/// The classes of "{A+B}".
std::optional<ZRError> setClasses(ObjectRuntime& runtime, ObjectInterface& interface,
                                  const ObjectInterface::Argument& argument,
                                  const std::string& type) {
    if (!type.ends_with('}')) return wrong(type);
    std::set<std::string> classes;
    for (std::string& name : split(std::string_view(type).substr(1, type.size() - 2), '+')) {
        if (!runtime.hasClass(name)) return wrong(name);
        classes.insert(std::move(name));
    }
    interface.setClasses(argument, std::move(classes));
    return std::nullopt;
}

}  // namespace

ProtocolRef ZRProtocolNamed(ObjectRuntime& runtime, const std::string& name,
                            std::optional<ZRError>* error) {
    if (auto protocol = runtime.protocol(name)) return protocol;
    constexpr const char* kText =
        "unable to locate protocol \"{}\" - check that it is defined and not inadvertently "
        "optimized away";
    EVLOG_DEFAULT(ops(), kText, name);
    report(error, fmt::format(kText, name));
    return nullptr;
}

ProtocolRef ZRCompoundProtocol(ObjectRuntime& runtime, const platform::Value& names,
                               std::optional<ZRError>* error) {
    if (names.string()) return ZRProtocolNamed(runtime, names.string()->string(), error);
    if (!names.array()) return nullptr;
    std::string name = "__XX_COMPOUND";
    for (const platform::Value& member : *names.array()) {
        if (!member.string()) return nullptr;
        name.append("__").append(*member.string());
    }
    auto compound = runtime.allocateProtocol(name);
    if (!compound) {
        auto existing = runtime.protocol(name);
        if (!existing) report(error, "unable to create compound protocol");
        return existing;
    }
    for (const platform::Value& member : *names.array()) {
        auto protocol = ZRProtocolNamed(runtime, member.string()->string(), error);
        if (!protocol) return nullptr;
        compound->incorporated.push_back(std::move(protocol));
    }
    return runtime.registerProtocol(std::move(compound));
}

std::optional<ZRError> ZRDescribeInterface(ObjectRuntime& runtime, ObjectInterface& interface,
                                           const std::string& operation,
                                           const std::string& description) {
    for (const std::string& entry : split(description, ',')) {
        const std::vector<std::string> fields = split(entry, ':');
        if (fields.size() != 3) return wrong(description);
        const std::string &direction = fields[0], &type = fields[2];
        if (direction != "request" && direction != "reply") return wrong(direction);
        const ObjectInterface::Argument argument{operation, decimalValue(fields[1]),
                                                 direction == "reply"};
        if (type.starts_with('{')) {
            if (auto error = setClasses(runtime, interface, argument, type)) return error;
            continue;
        }
        auto protocol = ZRProtocolNamed(runtime, type);
        if (!protocol) return wrong(type);
        interface.setInterface(argument, std::make_shared<ObjectInterface>(std::move(protocol)));
    }
    return std::nullopt;
}

}  // namespace zorvan
