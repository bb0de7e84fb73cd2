#include <gtest/gtest.h>
#include <unistd.h>

#include <thread>

#include "platform/logger/LogCapture.h"
#include "platform/logger/Logger.h"
#include "tests/support/TestSupport.h"

TEST(LoggerFormat, LineCarriesPriorityLocationAndText) {
    char path[] = "/tmp/sfr-log-XXXXXX";
    int fd = mkstemp(path);
    ASSERT_GE(fd, 0);
    close(fd);
    ASSERT_TRUE(Logger::SetFile(path));
    Logger::Put(11, "src/StreamBuffer", "Orvane::StreamBuffer::Start", 123, "Start %s.", "enter");
    Logger::Put(11, nullptr, nullptr, 0, "ST: V:%zu", size_t{3});
    Logger::Put(12, nullptr, nullptr, 0, "dropped at the default level");
    std::string text = testsupport::ReadFile(path);
    EXPECT_NE(text.find("<11> src/StreamBuffer:123 Orvane::StreamBuffer::Start: Start enter.\n"),
              std::string::npos)
        << text;
    EXPECT_NE(text.find("<11> ST: V:3\n"), std::string::npos);
    EXPECT_EQ(text.find("dropped"), std::string::npos);
    unlink(path);
}

TEST(LoggerLevel, CaptureSeesEveryPriorityAndLongLinesWhole) {
    LogCapture log;
    std::string longText(5000, 'a');
    Logger::Put(13, nullptr, nullptr, 0, "%s", longText.c_str());
    Logger::Put(13, "f", "g", 7, "trace %d", 42);
    auto records = log.Records();
    ASSERT_EQ(records.size(), 2u);
    EXPECT_EQ(records[0].message, longText);
    EXPECT_EQ(records[1].priority, 13);
    EXPECT_EQ(records[1].file, "f");
    EXPECT_EQ(records[1].line, 7);
    EXPECT_EQ(records[1].message, "trace 42");
}

TEST(LoggerLevel, LinesAboveTheLevelAreNotFormatted) {
    Logger::SetLevel(11);
    EXPECT_TRUE(Logger::Enabled(11));
    EXPECT_FALSE(Logger::Enabled(12));
    Logger::SetLevel(13);
    EXPECT_TRUE(Logger::Enabled(13));
    Logger::SetLevel(Logger::kDefaultLevel);
}

TEST(LoggerConcurrency, ConcurrentWritersLoseNoLine) {
    LogCapture log;
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([t] {
            for (int i = 0; i < 200; ++i) Logger::Put(13, nullptr, nullptr, 0, "t%d %d", t, i);
        });
    }
    for (auto& th : threads) th.join();
    EXPECT_EQ(log.Records().size(), 800u);
}
