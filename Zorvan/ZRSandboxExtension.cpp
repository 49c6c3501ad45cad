#include "Zorvan/ZRSandboxExtension.h"

#include "platform/sandbox/SandboxExtension.h"

namespace zorvan {

std::shared_ptr<ZRSandboxExtension> ZRSandboxExtension::initWithExtension(
    const std::string& token) {
    return std::shared_ptr<ZRSandboxExtension>(new ZRSandboxExtension(token));
}

ZRSandboxExtension::~ZRSandboxExtension() {
    expel();
}

void ZRSandboxExtension::consume() {
    if (handle_ == 0) handle_ = platform::consumeExtension(token());
}

void ZRSandboxExtension::expel() {
    platform::releaseExtension(handle_.exchange(0));
}

std::string ZRSandboxExtension::token() const {
    std::lock_guard lock(mutex_);
    return token_;
}

void ZRSandboxExtension::setToken(const std::string& token) {
    std::lock_guard lock(mutex_);
    token_ = token;
}

}  // namespace zorvan
