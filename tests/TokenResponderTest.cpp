// The token responder paces its answers: the first at once, then after a delay that doubles up
// to its cap, reset by a stored object; requests meanwhile share one answer; Stop ends a wait
// and a running answer.
#include <gtest/gtest.h>
#include <poll.h>
#include <unistd.h>

#include <chrono>
#include <mutex>
#include <vector>

#include "platform/framework/TokenResponder.h"
#include "tests/support/TestSupport.h"

namespace {

using Clock = std::chrono::steady_clock;
using std::chrono::milliseconds;

struct Answers {
    std::mutex mutex;
    std::vector<Clock::time_point> times;
    size_t Count() {
        std::lock_guard<std::mutex> lock(mutex);
        return times.size();
    }
};

TEST(TokenResponderConcurrency, AnswersArePacedByADoublingDelayThatAStoredObjectResets) {
    Answers answers;
    TokenResponder* self = nullptr;
    const int kRounds = 5;
    TokenResponder responder(
        [&] {
            std::lock_guard<std::mutex> lock(answers.mutex);
            answers.times.push_back(Clock::now());
            // The module asks again at once, as after every refused transfer.
            if (answers.times.size() < kRounds) self->Request();
        },
        [] {}, milliseconds(40), milliseconds(160));
    self = &responder;
    const auto start = Clock::now();
    for (int i = 0; i < 10; ++i) responder.Request();  // one answer for all of them
    ASSERT_TRUE(testsupport::WaitUntil([&] { return answers.Count() == kRounds; }, 30000));
    std::lock_guard<std::mutex> lock(answers.mutex);
    const int expected[] = {40, 80, 160, 160};  // no answer before its delay; then the cap
    for (int i = 1; i < kRounds; ++i)
        EXPECT_GE(answers.times[i] - answers.times[i - 1], milliseconds(expected[i - 1])) << i;
    EXPECT_LT(answers.times[0] - start, std::chrono::seconds(10));  // the first at once
}

TEST(TokenResponderConcurrency, StoredObjectEndsTheWaitAndStopEndsWaitAndAnswer) {
    Answers answers;
    int cancel[2];
    ASSERT_EQ(pipe(cancel), 0);
    bool cancelSeen = false;
    {
        TokenResponder responder(
            [&] {
                {
                    std::lock_guard<std::mutex> lock(answers.mutex);
                    answers.times.push_back(Clock::now());
                    if (answers.times.size() < 3) return;
                }
                // A long fetch: returns when the responder stops.
                pollfd p{cancel[0], POLLIN, 0};
                cancelSeen = poll(&p, 1, 600000) == 1;
            },
            [&] { EXPECT_EQ(write(cancel[1], "x", 1), 1); }, std::chrono::minutes(10),
            std::chrono::minutes(10));
        responder.Request();
        ASSERT_TRUE(testsupport::WaitUntil([&] { return answers.Count() == 1; }, 30000));
        responder.Request();       // would wait 10 minutes ...
        responder.ObjectStored();  // ... but an object was stored: answered at once
        ASSERT_TRUE(testsupport::WaitUntil([&] { return answers.Count() == 2; }, 30000));
        responder.ObjectStored();
        responder.Request();
        ASSERT_TRUE(testsupport::WaitUntil([&] { return answers.Count() == 3; }, 30000));
        responder.Stop();     // ends the running answer through `cancel`
        responder.Request();  // ignored once stopped
    }
    EXPECT_TRUE(cancelSeen);
    EXPECT_EQ(answers.Count(), 3u);
    for (int fd : cancel) close(fd);
}

}  // namespace
