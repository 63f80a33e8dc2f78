#include "platform/linux/DatagramNotifications.h"

#include <gtest/gtest.h>

#include "fakes/FakeDispatch.h"

namespace mx::testing {
namespace {

// A flood of posts costs the queue one look while one is waiting, never one a post.
TEST(DatagramNotificationsTest, PostsWhileOneWaitsAreFoldedIntoIt)
{
    FakeDispatch dispatch;
    auto queue = dispatch.makeSerialQueue("server", QueuePriority::UserInteractive);
    DatagramNotifications notifications("/nonexistent/notify.sock");
    int token = 0;
    std::vector<int> handled;
    notifications.registerDispatch("changed", token, queue, [&](int delivered) {
        handled.push_back(delivered);
        notifications.deliver("changed"); // a post while the handler runs: looked at again
    });
    for (int i = 0; i < 100000; ++i)
        notifications.deliver("changed");
    notifications.deliver("other name");
    ASSERT_TRUE(static_cast<FakeWorkQueue&>(*queue).runOne());
    EXPECT_EQ(handled, std::vector<int>{token});
    ASSERT_TRUE(static_cast<FakeWorkQueue&>(*queue).runOne()) << "the post made during the handler";
    EXPECT_EQ(handled.size(), 2u);
}

} // namespace
} // namespace mx::testing
