// The real stream-file-recorder binary with -metrics: /healthz and /metrics scraped with curl
// while it records, the figures checked against the JSON lines of the same run; an address it
// cannot serve at ends the start.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <filesystem>
#include <map>
#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "tests/support/TestSupport.h"

namespace {

namespace fs = std::filesystem;
using testsupport::BuildPath;
using testsupport::ReadFile;
using testsupport::RunProcess;
using testsupport::Words;
using Args = std::vector<std::string>;

Args operator+(Args a, const Args& b) {
    a.insert(a.end(), b.begin(), b.end());
    return a;
}

// The body and status of a GET, as curl gives them: {"" , 0} when nothing answered.
struct Answer {
    std::string body;
    int status = 0;
};
Answer Get(const std::string& url) {
    auto r = RunProcess({"curl", "-s", "-m", "10", "-w", "\n%{http_code}", url}, 20000);
    Answer a;
    const auto cut = r.output.rfind('\n');
    if (cut == std::string::npos) return a;
    a.body = r.output.substr(0, cut);
    a.status = std::atoi(r.output.c_str() + cut + 1);
    return a;
}

// A scrape's samples: "name{labels}" -> value.
std::map<std::string, double> Samples(const std::string& text) {
    std::map<std::string, double> samples;
    std::istringstream lines(text);
    for (std::string line; std::getline(lines, line);) {
        if (line.empty() || line[0] == '#') continue;
        const auto space = line.rfind(' ');
        samples[line.substr(0, space)] = std::atof(line.c_str() + space + 1);
    }
    return samples;
}

// What the status output said so far.
struct Said {
    long stored = 0;   // LastSequenceNumNotify entries that succeeded
    long givenUp = 0;  // ... that did not
    double bytes = 0;  // FileSize of the UploadInfo lines with ErrorCode Success
    int state = 0;     // the last ProcessStatus
    unsigned code = 0;
    bool operator==(const Said& o) const {
        return stored == o.stored && givenUp == o.givenUp && bytes == o.bytes && state == o.state &&
               code == o.code;
    }
};
Said ReadStatus(const std::string& path) {
    Said said;
    std::istringstream lines(ReadFile(path));
    const std::regex entry("\"succeeded\":(true|false)");
    const std::regex upload("ErrorCode, Success, ResponseTime, [0-9]+, FileSize, ([0-9]+)");
    const std::regex status("\"state\":([0-9]+),\"code\":([0-9]+)");
    for (std::string line; std::getline(lines, line);) {
        std::smatch m;
        if (line.find("\"LastSequenceNumNotify\"") != std::string::npos &&
            std::regex_search(line, m, entry))
            ++(m[1] == "true" ? said.stored : said.givenUp);
        if (std::regex_search(line, m, upload)) said.bytes += std::stod(m[1]);
        if (line.find("\"ProcessStatus\"") != std::string::npos &&
            std::regex_search(line, m, status)) {
            said.state = std::stoi(m[1]);
            said.code = static_cast<unsigned>(std::stoul(m[2]));
        }
    }
    return said;
}

Args RecorderArgs(const std::string& dir, const Args& extra) {
    fs::create_directories(dir + "/store/rec");
    const std::string clip = testsupport::MediaClip(
        "metrics_clip.ts",
        Words("-f lavfi -i testsrc2=size=320x240:rate=30:duration=12 -f lavfi -i "
              "sine=frequency=440:sample_rate=48000:duration=12 -pix_fmt yuv420p -c:a aac "
              "-c:v libx264 -preset ultrafast -g 30 -bf 0"));
    return Args{BuildPath("stream-file-recorder"), "-input", clip} +
           Words(
               "-uploadinterval 1 -bufferfullsize 100 -authretrytime 3000 -kct h264 "
               "-bucketname rec -readrate 1") +
           Args{"-endpoint", "file://" + dir + "/store",
                "-status",   dir + "/status.jsonl",
                "-logfile",  dir + "/log.txt"} +
           extra;
}

}  // namespace

TEST(MetricsTest, ScrapesDuringARunAgreeWithItsStatusLines) {
    const std::string dir = BuildPath("e2e/metrics-" + std::to_string(getpid()));
    fs::remove_all(dir);
    const std::string address = "127.0.0.1:" + std::to_string(testsupport::FreePort(SOCK_STREAM));
    testsupport::ChildProcess recorder(RecorderArgs(dir, {"-metrics", address}),
                                       dir + "/output.txt");
    const std::string url = "http://" + address;

    Answer health;
    ASSERT_TRUE(testsupport::WaitUntil(
        [&] { return (health = Get(url + "/healthz")).status == 200; }, 60000))
        << health.status << " " << health.body << ReadFile(dir + "/log.txt");
    EXPECT_EQ(health.body, "Executing 0\n");

    // Objects are stored while the scrape runs: compare when the status lines did not change
    // around the scrape, and once at least two objects were stored.
    std::map<std::string, double> m;
    Said said;
    const bool agreed = testsupport::WaitUntil(
        [&] {
            const Said before = ReadStatus(dir + "/status.jsonl");
            m = Samples(Get(url + "/metrics").body);
            said = ReadStatus(dir + "/status.jsonl");
            return before.stored >= 2 && before == said &&
                   m["recorder_objects_total{result=\"Success\"}"] == said.stored &&
                   m["recorder_stored_bytes_total"] == said.bytes &&
                   m["recorder_process_state"] == said.state &&
                   m["recorder_process_status_code"] == said.code;
        },
        60000);
    ASSERT_TRUE(agreed) << "status lines: " << said.stored << " stored, " << said.bytes
                        << " bytes, state " << said.state << "\nscrape:\n"
                        << Get(url + "/metrics").body;
    EXPECT_EQ(said.state, 4);
    EXPECT_EQ(said.givenUp, 0);
    EXPECT_GE(m["recorder_transfer_seconds_count"], said.stored);
    EXPECT_EQ(m["recorder_file_buffer_limit_ms"], 100000);
    EXPECT_GT(m["recorder_samples_received_total{media=\"video\"}"], 30);
    EXPECT_GT(m["recorder_samples_received_total{media=\"audio\"}"], 30);
    EXPECT_EQ(m["recorder_queue_overflows_total{media=\"video\"}"], 0);
    EXPECT_EQ(m["recorder_input_reopenings_total"], 0);
    EXPECT_GT(m["recorder_last_object_capture_time_seconds"], 1.6e9);

    recorder.Signal(SIGINT);
    EXPECT_EQ(recorder.Wait(60000), 0) << ReadFile(dir + "/log.txt");
}

TEST(MetricsTest, AnAddressItCannotServeAtEndsTheStart) {
    const std::string dir = BuildPath("e2e/metrics-bad-" + std::to_string(getpid()));
    fs::remove_all(dir);
    const struct {
        std::string address;
        std::string says;
    } cases[] = {
        {"127.0.0.1", "bad option: -metrics needs IP:PORT"},
        {"localhost:9464", "bad option: -metrics needs IP:PORT"},
        // Not an address of this machine: binding fails, nothing is sent.
        {"192.0.2.1:9464", "-metrics 192.0.2.1:9464: cannot serve there: cannot bind"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.address);
        fs::remove(dir + "/log.txt");
        auto r = RunProcess(RecorderArgs(dir, {"-metrics", c.address}), 60000);
        EXPECT_EQ(r.exitStatus, 1);
        const std::string log = ReadFile(dir + "/log.txt");
        EXPECT_NE(log.find(c.says), std::string::npos) << log;
    }
}
