#include "platform/threads/SerialQueue.h"

#include <gtest/gtest.h>
#include <pthread.h>

#include <string>
#include <thread>
#include <vector>

#include "platform/threads/RunLoop.h"
#include "platform/threads/SyncQueue.h"

namespace platform {
namespace {

TEST(SerialQueue, RunsEverythingInOrderOnItsOwnThread) {
    std::vector<int> order;
    std::string name;
    {
        SerialQueue queue("a label of more than 15 characters");
        queue.async([&] {
            char buffer[16];
            pthread_getname_np(pthread_self(), buffer, sizeof buffer);
            name = buffer;
            queue.assertCurrent();
        });
        for (int i = 0; i < 1000; ++i) queue.async([&order, i] { order.push_back(i); });
        EXPECT_FALSE(queue.isCurrent());
    }
    EXPECT_EQ(name, "a label of more");
    ASSERT_EQ(order.size(), 1000u);
    EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
}

TEST(SerialQueue, UsesTheLoopItIsGiven) {
    RunLoop loop;
    SerialQueue queue("lum", loop);
    bool ran = false;
    queue.async([&] { ran = queue.isCurrent(); });
    EXPECT_FALSE(ran);
    loop.poll();
    EXPECT_TRUE(ran);
}

TEST(SerialQueueDeathTest, StopsTheProcessWhenMisused) {
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(SerialQueue("mine").assertCurrent(),
                 "TestBody \\(.*tests/platform/threads/SerialQueueTest.cpp:[0-9]+\\): not on queue "
                 "\"mine\"");
    SyncQueue sync("state");
    EXPECT_DEATH(sync.assertCurrent(), "not inside queue \"state\"");
    EXPECT_DEATH(sync.sync([&] { sync.sync([] {}); }), "\"state\" was entered again");
}

TEST(SyncQueue, LetsOneInAtATime) {
    SyncQueue queue("state");
    int count = 0;
    std::vector<std::thread> threads;
    for (int i = 0; i < 4; ++i)
        threads.emplace_back([&] {
            for (int j = 0; j < 1000; ++j) {
                queue.sync([&] {
                    queue.assertCurrent();
                    count += 1;
                });
            }
        });
    for (std::thread& thread : threads) thread.join();
    EXPECT_EQ(queue.sync([&] { return count; }), 4000);
}

}  // namespace
}  // namespace platform
