// Guards: an input given only in SFR_INPUT_URL (so that its password is not in the process
// list) being ignored, -input losing to the environment, and a stream id named after a URL's
// query (which would put a token into every key).
#include <gtest/gtest.h>
#include <stdlib.h>

#include "platform/framework/FrameworkOptions.h"

namespace {

TEST(FrameworkOptionsTest, InputFromTheEnvironmentOrTheCommandLine) {
    const struct {
        const char* environment;  // nullptr: unset
        std::vector<std::string> arguments;
        const char* input;
        const char* streamingId;
    } cases[] = {
        {"rtsp://u:p@cam/live?token=abc", {}, "rtsp://u:p@cam/live?token=abc", "live"},
        {"rtsp://cam/env",
         {"-input", "/clips/front door.mp4"},
         "/clips/front door.mp4",
         "front_door"},
        {nullptr, {"-input", "srt://h:9000?passphrase=x"}, "srt://h:9000?passphrase=x", "h_9000"},
        {"", {}, "", ""},
    };
    for (const auto& c : cases) {
        if (c.environment)
            setenv("SFR_INPUT_URL", c.environment, 1);
        else
            unsetenv("SFR_INPUT_URL");
        std::vector<std::string> words = {"recorder"};
        words.insert(words.end(), c.arguments.begin(), c.arguments.end());
        std::vector<char*> argv;
        for (auto& w : words) argv.push_back(w.data());
        std::vector<std::string> errors;
        const FrameworkOptions o =
            FrameworkOptions::Read(CommandLine(static_cast<int>(argv.size()), argv.data()), errors);
        EXPECT_TRUE(errors.empty());
        EXPECT_EQ(o.input, c.input);
        EXPECT_EQ(o.streamingId, c.streamingId) << c.input;
    }
    unsetenv("SFR_INPUT_URL");
}

}  // namespace
