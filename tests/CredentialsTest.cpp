// Credentials for the standalone host: a credential process cannot wedge the recorder (one
// deadline, its whole process group ended, a helper's background child does not hold the read
// open), and no key, token or region that could break a request line gets through.
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <unistd.h>

#include <thread>

#include "platform/framework/Credentials.h"
#include "tests/support/TestSupport.h"

namespace {

using testsupport::ReadFile;

// True once process `pid` is gone (or a zombie waiting for a parent that is not us).
bool Gone(const std::string& pidText) {
    const std::string stat =
        ReadFile("/proc/" + std::to_string(std::atoi(pidText.c_str())) + "/stat");
    return stat.empty() || stat.find(") Z") != std::string::npos;
}

TEST(CredentialsTest, CredentialProcessIsBoundedAndLeavesNoProcessBehind) {
    const std::string pidFile =
        testsupport::BuildPath("cred-child-" + std::to_string(getpid()) + ".pid");
    const std::string json =
        "printf '{\"AccessKeyId\":\"A\",\"SecretAccessKey\":\"S\",\"SessionToken\":\"T\"}'";
    const struct {
        std::string command;
        int timeoutMs;
        bool cancelled, ok;
        std::string why;
    } cases[] = {
        // The JSON is complete and the shell has exited: read although the pipe stays open.
        {json + "; sleep 600 & echo $! > " + pidFile, 60000, false, true, ""},
        {"sleep 600 & echo $! > " + pidFile + "; wait", 200, false, false,
         "it took longer than 0 s"},
        {"sleep 600 & echo $! > " + pidFile + "; wait", 60000, true, false,
         "the recorder is stopping"},
        {json + "; exit 3", 60000, false, false, "it exited with status 3"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.command);
        unlink(pidFile.c_str());
        int cancel[2];
        ASSERT_EQ(pipe(cancel), 0);
        std::thread canceller([&] {
            // Cancelled once the child is running.
            if (!c.cancelled) return;
            testsupport::WaitUntil([&] { return !ReadFile(pidFile).empty(); }, 30000);
            EXPECT_EQ(write(cancel[1], "x", 1), 1);
        });
        std::string output, why;
        EXPECT_EQ(credentials::RunCommand(c.command, c.timeoutMs, cancel[0], &output, &why), c.ok)
            << why;
        canceller.join();
        EXPECT_EQ(why, c.why);
        EXPECT_TRUE(!c.ok || output.find("\"SessionToken\":\"T\"") != std::string::npos);
        // Nothing of the group outlives the call.
        EXPECT_TRUE(ReadFile(pidFile).empty() ||
                    testsupport::WaitUntil([&] { return Gone(ReadFile(pidFile)); }, 30000));
        for (int fd : cancel) close(fd);
    }
    unlink(pidFile.c_str());
}

TEST(CredentialsTest, ControlCharactersInKeysOrTokenAreRefused) {
    const std::pair<std::string, std::string> cases[] = {
        {"AWS_ACCESS_KEY_ID", "AKID\r\nX-Injected: 1"},
        {"AWS_SECRET_ACCESS_KEY", "s\n"},
        {"AWS_SESSION_TOKEN", "\x7f"},
        {"its AccessKeyId", "A\\r\\nX-Injected: 1"},  // of a credential process, JSON-escaped
    };
    for (const auto& [name, value] : cases) {
        SCOPED_TRACE(name);
        std::map<std::string, std::string> environment = {{"AWS_ACCESS_KEY_ID", "AKID"},
                                                          {"AWS_SECRET_ACCESS_KEY", "s"}};
        environment[name] = value;
        auto lookup = name.rfind("AWS_", 0) == 0
                          ? credentials::FromEnvironment(testsupport::EnvOf(environment))
                          : credentials::FromCredentialProcess(
                                "printf '{\"AccessKeyId\":\"%s\",\"SecretAccessKey\":\"S\","
                                "\"SessionToken\":\"T\"}' '" +
                                value + "'");
        EXPECT_FALSE(lookup.Ok());
        EXPECT_NE(lookup.why.find(name + " holds a control character"), std::string::npos)
            << lookup.why;
        EXPECT_EQ(lookup.why.find("X-Injected"), std::string::npos);
    }
}

}  // namespace
