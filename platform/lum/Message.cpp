#include "platform/lum/Message.h"

namespace platform {

Message Message::replyTo(const Message& request) {
    Message reply;
    reply.serial_ = request.serial_;
    return reply;
}

std::string describe(const Message& message) {
    return describeWhole(message.contents());
}

}  // namespace platform
