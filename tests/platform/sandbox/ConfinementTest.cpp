#include <gtest/gtest.h>
#include <sys/resource.h>

#include "platform/sandbox/Sandbox.h"

namespace platform {

namespace {

TEST(Confinement, ALookThatFailedDoesNotCountForEver) {
    const auto self = AuditToken::ofSelf();
    ASSERT_TRUE(self);
    rlimit before{};
    ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &before), 0);
    const rlimit none{0, before.rlim_max};
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &none), 0);
    EXPECT_TRUE(isConfined(*self));
    ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &before), 0);
    EXPECT_FALSE(isConfined(*self));
}

}  // namespace

}  // namespace platform
