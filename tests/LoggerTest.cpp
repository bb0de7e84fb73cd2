// The logger. Faults guarded: a line without its priority, location or text, or a line of a
// priority beyond the level written; a capture missing a line or cutting a long one; a line split
// by a value's control characters; a storm of one repeated warning; a log file opened through a
// planted link or created readable by others; lines lost between concurrent writers.
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <thread>

#include "platform/logger/Logger.h"
#include "tests/support/LogCapture.h"
#include "tests/support/TestSupport.h"

TEST(LoggerFormat, LineCarriesPriorityLocationAndTextAndCaptureSeesEveryLineWhole) {
    LogCapture log;
    const std::string path = testsupport::ScratchDir("logformat") + "/log.txt";
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

    std::string longText(5000, 'a');
    Logger::Put(13, nullptr, nullptr, 0, "%s", longText.c_str());
    auto records = log.Records();
    ASSERT_EQ(records.size(), 4u);  // every priority, while a capture lives
    EXPECT_EQ(records[0].file, "src/StreamBuffer");
    EXPECT_EQ(records[0].message, "Start enter.");
    EXPECT_EQ(records[3].message, longText);
}

// What a log file never holds: a line split by a value's control characters, a storm of one
// repeated warning, or anything written through a planted link.
TEST(LoggerFormat, ControlCharactersEscapedRepeatedWarningsCondensedLinksNotFollowed) {
    const std::string dir = testsupport::ScratchDir("logfile");
    const std::string path = dir + "/log.txt";
    ASSERT_TRUE(Logger::SetFile(path));
    Logger::Put(11, nullptr, nullptr, 0, "stream id %s", "cam\r\n2026-01-01 <4> forged");
    for (int i = 0; i < 1000; ++i) Logger::Put(5, "f", "g", 7, "store refused: %s", "NoSuchBucket");
    std::string text = testsupport::ReadFile(path);
    EXPECT_NE(text.find("stream id cam\\x0d\\x0a2026-01-01 <4> forged\n"), std::string::npos);
    EXPECT_EQ(text.find("store refused"), text.rfind("store refused")) << text.substr(0, 2000);
    struct stat st {};
    ASSERT_EQ(stat(path.c_str(), &st), 0);
    EXPECT_EQ(
        st.st_mode & 0777, 0640u & ~[] {
            mode_t mask = umask(0);
            umask(mask);
            return mask;
        }());

    const std::string link = dir + "/link.txt";
    ASSERT_EQ(symlink(path.c_str(), link.c_str()), 0);
    EXPECT_FALSE(Logger::SetFile(link));
    // The system's links to the process's own streams are followed.
    for (const char* own : {"/dev/stderr", "/proc/self/fd/2"}) {
        const int fd = Logger::OpenAppend(own);
        EXPECT_GE(fd, 0) << own;
        if (fd >= 0) close(fd);
    }
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
