#include "platform/services/NotificationListener.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <thread>

#include "platform/services/Notifications.h"
#include "platform/system/Directories.h"
#include "platform/threads/RunLoop.h"
#include "tests/support/TemporaryDirectory.h"

namespace platform {
namespace {

class NotificationListenerTest : public testing::Test {
  protected:
    void post(int times) {
        for (; times > 0; --times) notifications_->post("name");
        notifications_->finish();
    }
    NotificationListener listen() {
        return std::move(*NotificationListener::make(directories_, "name"));
    }

    test::TemporaryDirectory files_;
    Directories directories_;
    const std::string folder_ = files_.path("run/zorvan/notify");
    const std::unique_ptr<Notifications> notifications_ = [this] {
        directories_.runtime = files_.path("run");
        return makeFileNotifications(directories_);
    }();
};

TEST_F(NotificationListenerTest, EveryListenerCountsEveryPostSinceItWasMade) {
    NotificationListener first = listen();
    EXPECT_EQ(*first.take(), 0u) << "nobody has ever posted";
    post(3);
    notifications_->post("other");
    notifications_->finish();
    NotificationListener second = listen();
    post(2);
    EXPECT_EQ(*first.take(), 5u);
    EXPECT_EQ(*second.take(), 2u);
    EXPECT_EQ(*second.take(), 0u);
    EXPECT_FALSE(NotificationListener::make(directories_, "../name"));
    directories_.runtime = files_.write("file", "");
    EXPECT_FALSE(NotificationListener::make(directories_, "name"));
}

TEST_F(NotificationListenerTest, CountsThatBeginAnewLoseNoPost) {
    NotificationListener listener = listen();
    post(2);
    EXPECT_EQ(*listener.take(), 2u);
    std::filesystem::remove(folder_ + "/name");
    post(4);
    EXPECT_EQ(*listener.take(), 4u);
    files_.write("run/zorvan/notify/name", "damaged");
    post(1);
    EXPECT_EQ(*listener.take(), 1u);
    for (const bool moved : {false, true}) {
        if (moved)
            std::filesystem::rename(folder_, folder_ + ".old");
        else
            std::filesystem::remove_all(folder_);
        post(1);
        EXPECT_EQ(*listener.take(), 1u) << moved;
        post(2);
        EXPECT_EQ(*listener.take(), 2u) << moved;
    }
}

TEST_F(NotificationListenerTest, ARunLoopWakesUpForPostsOfOthers) {
    NotificationListener listener = listen();
    RunLoop loop;
    RunLoop::Watch watch(loop, listener.descriptor());
    std::uint64_t seen = 0;
    std::function<void()> await = [&] {
        watch.awaitReadable([&] {
            seen += *listener.take();
            seen < 100 ? await() : loop.stop();
        });
    };
    await();
    std::thread poster([this] { post(100); });
    loop.run();
    poster.join();
    EXPECT_EQ(seen, 100u);
}

}  // namespace
}  // namespace platform
