#include "platform/lum/ReplyBudget.h"

#include <gtest/gtest.h>

namespace platform::lum {
namespace {

TEST(ReplyBudget, LetsRequestsInWhileTheirRepliesFit) {
    RunLoop loop;
    auto budget = std::make_shared<ReplyBudget>(loop);
    std::size_t entered = 0;
    while (budget->tryEnter()) entered += 1;
    EXPECT_EQ(entered, kMaxUnsentTotal / kMaxUnsentPerConnection);

    // The first reply shows that replies are large: from now on one request at a time.
    budget->add(kMaxUnsentTotal);
    for (; entered > 0; --entered) budget->leave();
    EXPECT_TRUE(budget->tryEnter());
    EXPECT_FALSE(budget->tryEnter());
    budget->leave();

    budget->add(1);
    EXPECT_FALSE(budget->tryEnter());
    std::string order;
    for (char name : {'a', 'b', 'c'})
        budget->await([&order, &budget, name] {
            if (budget->tryEnter()) order += name;
        });
    loop.poll();
    EXPECT_EQ(order, "");
    budget->remove(1);
    EXPECT_FALSE(budget->tryEnter()) << "those who wait come first";
    loop.poll();
    EXPECT_EQ(order, "a");
    budget->leave();
    loop.poll();
    EXPECT_EQ(order, "ab");
    budget->remove(kMaxUnsentTotal);
    budget->leave();
    loop.poll();
    EXPECT_EQ(order, "abc");
}

}  // namespace
}  // namespace platform::lum
