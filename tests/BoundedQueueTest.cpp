#include <gtest/gtest.h>

#include <atomic>
#include <memory>
#include <thread>

#include "modulebase/BoundedQueue.h"
#include "tests/support/TestSupport.h"

TEST(BoundedQueueOverflow, RefusesTheNewestItemAndKeepsTheOthersInOrder) {
    BoundedQueue<int> queue(3);
    EXPECT_TRUE(queue.Push(1));
    EXPECT_TRUE(queue.Push(2));
    EXPECT_TRUE(queue.Push(3));
    EXPECT_FALSE(queue.Push(4));
    EXPECT_EQ(queue.Pop(), 1);
    EXPECT_TRUE(queue.Push(5));  // room again after a pop
    EXPECT_EQ(queue.Pop(), 2);
    EXPECT_EQ(queue.Pop(), 3);
    EXPECT_EQ(queue.Pop(), 5);
}

TEST(BoundedQueueOverflow, ARefusedItemIsReleased) {
    BoundedQueue<std::shared_ptr<int>> queue(1);
    auto kept = std::make_shared<int>(1);
    auto refused = std::make_shared<int>(2);
    std::weak_ptr<int> watch = refused;
    ASSERT_TRUE(queue.Push(kept));
    ASSERT_FALSE(queue.Push(std::move(refused)));
    EXPECT_TRUE(watch.expired());
}

TEST(BoundedQueueClear, DefaultPredicateRemovesEverythingAndReplacedOneKeepsOrder) {
    BoundedQueue<int> queue(10);
    for (int i = 0; i < 6; ++i) queue.Push(i);
    queue.Clear();
    EXPECT_EQ(queue.Size(), 0u);

    queue = [](int v) { return v % 2 == 0; };  // remove even values
    for (int i = 0; i < 6; ++i) queue.Push(i);
    queue.Clear();
    ASSERT_EQ(queue.Size(), 3u);
    EXPECT_EQ(queue.Pop(), 1);
    EXPECT_EQ(queue.Pop(), 3);
    EXPECT_EQ(queue.Pop(), 5);
}

TEST(BoundedQueueClear, EmptyPredicateThrows) {
    BoundedQueue<int> queue(2);
    queue.Push(1);
    queue = std::function<bool(int)>();
    EXPECT_THROW(queue.Clear(), std::bad_function_call);
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
            for (int i = 1; i <= 1000; ++i) {
                while (!queue.Push(i)) std::this_thread::yield();
            }
        });
    }
    for (auto& t : producers) t.join();
    consumer.join();
    EXPECT_EQ(sum.load(), 4L * 1000 * 1001 / 2);
}
