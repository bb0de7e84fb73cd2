// BoundedQueue. Guards: an overflow that blocks, drops the wrong item or keeps a refused item
// alive; and (under TSan) items lost or duplicated while producers race a waiting consumer.
#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <thread>

#include "modulebase/BoundedQueue.h"
#include "tests/support/TestSupport.h"

TEST(BoundedQueueOverflow, RefusesTheNewestItemAndKeepsTheOthersInOrder) {
    BoundedQueue<int> queue(3);
    for (int i = 1; i <= 3; ++i) EXPECT_TRUE(queue.Push(i));
    EXPECT_FALSE(queue.Push(4));
    EXPECT_EQ(queue.Pop(), 1);
    EXPECT_TRUE(queue.Push(5));  // room again after a pop
    EXPECT_EQ(queue.Pop(), 2);
    EXPECT_EQ(queue.Pop(), 3);
    EXPECT_EQ(queue.Pop(), 5);

    BoundedQueue<std::shared_ptr<int>> shared(1);
    auto refused = std::make_shared<int>(2);
    std::weak_ptr<int> watch = refused;
    ASSERT_TRUE(shared.Push(std::make_shared<int>(1)));
    ASSERT_FALSE(shared.Push(std::move(refused)));
    EXPECT_TRUE(watch.expired());  // a refused item is released
}

TEST(BoundedQueueConcurrency, PopWaitsForPushAndEveryItemArrivesOnce) {
    BoundedQueue<int> queue(1000);
    std::atomic<long> sum{0};
    std::thread consumer([&] {
        for (int i = 0; i < 4000; ++i) sum += queue.Pop();
    });
    std::vector<std::thread> producers;
    for (int p = 0; p < 4; ++p) {
        producers.emplace_back([&] {
            for (int i = 1; i <= 1000; ++i)
                while (!queue.Push(i)) std::this_thread::yield();
        });
    }
    for (auto& t : producers) t.join();
    consumer.join();
    EXPECT_EQ(sum.load(), 4L * 1000 * 1001 / 2);
}
