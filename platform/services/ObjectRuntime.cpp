#include "platform/services/ObjectRuntime.h"

#include <utility>

namespace platform {

ObjectRuntime& ObjectRuntime::shared() {
    static ObjectRuntime runtime;
    return runtime;
}

ProtocolRef ObjectRuntime::protocol(const std::string& name) const {
    std::lock_guard lock(mutex_);
    auto found = protocols_.find(name);
    return found != protocols_.end() ? found->second : nullptr;
}

std::unique_ptr<Protocol> ObjectRuntime::allocateProtocol(const std::string& name) const {
    if (protocol(name)) return nullptr;
    return std::make_unique<Protocol>(Protocol{name, {}});
}

ProtocolRef ObjectRuntime::registerProtocol(std::unique_ptr<Protocol> protocol) {
    std::lock_guard lock(mutex_);
    const std::string name = protocol->name;
    return protocols_.try_emplace(name, std::move(protocol)).first->second;
}

void ObjectRuntime::registerClass(const std::string& name) {
    std::lock_guard lock(mutex_);
    classes_.insert(name);
}

bool ObjectRuntime::hasClass(const std::string& name) const {
    std::lock_guard lock(mutex_);
    return classes_.contains(name);
}

void ObjectInterface::setClasses(const Argument& argument, std::set<std::string> classes) {
    classes_[argument] = std::move(classes);
}

void ObjectInterface::setInterface(const Argument& argument,
                                   std::shared_ptr<const ObjectInterface> interface) {
    interfaces_[argument] = std::move(interface);
}

const std::set<std::string>* ObjectInterface::classes(const Argument& argument) const {
    auto found = classes_.find(argument);
    return found != classes_.end() ? &found->second : nullptr;
}

std::shared_ptr<const ObjectInterface> ObjectInterface::interface(const Argument& argument) const {
    auto found = interfaces_.find(argument);
    return found != interfaces_.end() ? found->second : nullptr;
}

}  // namespace platform
