#pragma once

#include <cstddef>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <vector>

namespace platform {

/// A named set of operations, which may incorporate others. Immutable once registered.
struct Protocol {
    std::string name;
    std::vector<std::shared_ptr<const Protocol>> incorporated;
};
using ProtocolRef = std::shared_ptr<const Protocol>;

/// The protocols and classes that a program knows by name. From any thread.
class ObjectRuntime {
  public:
    /// The process's.
    static ObjectRuntime& shared();

    /// Null for an unknown name.
    ProtocolRef protocol(const std::string& name) const;
    /// A new protocol that nobody finds before it is registered; null when the name is taken.
    std::unique_ptr<Protocol> allocateProtocol(const std::string& name) const;
    /// The protocol under its name: this one, or the one that came first.
    ProtocolRef registerProtocol(std::unique_ptr<Protocol> protocol);

    void registerClass(const std::string& name);
    bool hasClass(const std::string& name) const;

  private:
    mutable std::mutex mutex_;  // guards what follows
    std::map<std::string, ProtocolRef> protocols_;
    std::set<std::string> classes_;
};

/// How the objects of one protocol travel: for each argument of each operation, or of its reply,
/// which classes are allowed, or that it is a proxy itself. Not synchronised.
class ObjectInterface {
  public:
    explicit ObjectInterface(ProtocolRef protocol) : protocol_(std::move(protocol)) {}

    /// One argument: of the call, or of the reply's callback.
    struct Argument {
        std::string operation;
        std::size_t index = 0;
        bool ofReply = false;
        auto operator<=>(const Argument&) const = default;  // NOLINT(modernize-use-nullptr)
    };

    const ProtocolRef& protocol() const { return protocol_; }
    void setClasses(const Argument& argument, std::set<std::string> classes);
    void setInterface(const Argument& argument, std::shared_ptr<const ObjectInterface> interface);
    /// Null when nothing was set.
    const std::set<std::string>* classes(const Argument& argument) const;
    std::shared_ptr<const ObjectInterface> interface(const Argument& argument) const;

  private:
    ProtocolRef protocol_;
    std::map<Argument, std::set<std::string>> classes_;
    std::map<Argument, std::shared_ptr<const ObjectInterface>> interfaces_;
};

}  // namespace platform
