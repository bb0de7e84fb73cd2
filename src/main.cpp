// Process entry: one ProcessControl, the framework's message loop, the exit status.
//
// Exit statuses (ExitStatus): 0 after a normal run, 1 when the start fails, 2 when the recorder
// stopped on a module error, 3 when every stream file was given up and none stored. --help and
// --version print to stdout and exit 0 without starting anything. With -metrics, the metrics
// server starts once the process is initialized and stops before the process is torn down; an
// address it cannot listen at fails the start like a bad option.
#include <cstdio>
#include <memory>
#include <string>

#include "platform/logger/Logger.h"
#include "platform/metrics/MetricsExporter.h"
#include "platform/playback/PlaylistWriter.h"
#include "src/ProcessControl.h"

namespace {

constexpr const char* kVersion = "1.21.0.03290";
constexpr const char* kProgram = "stream-file-recorder";
constexpr const char* kExample =
    "stream-file-recorder -input rtsp://camera/stream -bucketname my-bucket -uploadinterval 10 "
    "-authretrytime 3000 -bufferfullsize 6 -kct h264 -region eu-west-1";

}  // namespace

int main(int argc, char** argv) {
    const std::string request = CommandLine(argc, argv).Request();
    if (request == "version") {
        std::printf("%s %s\n", kProgram, kVersion);
        return kExitNormal;
    }
    if (request == "help") {
        std::fputs(UsageText(kProgram, Orvane::ProcessControl::RecorderOptions(),
                             FrameworkOptions::Help(), kExample)
                       .c_str(),
                   stdout);
        return kExitNormal;
    }
    int exitCode = kExitNormal;
    {
        Orvane::ProcessControl process(argc, argv);
        Logger::Put(6, nullptr, "main", 0, "VQ-VERSION:%s", kVersion);
        // Declared after `process`, so it unsubscribes before the process goes.
        std::unique_ptr<PlaylistWriter> playlists;
        if (CurrentFrameworkOptions().playlist)
            playlists = PlaylistWriter::Subscribed(CurrentFrameworkOptions().keyPrefix);
        // Declared after the process, so it is destroyed first: it reads the process.
        std::unique_ptr<MetricsExporter> metrics;
        bool started = process.Initialize();
        if (started && !process.Options().metrics.empty()) {
            metrics = std::make_unique<MetricsExporter>([&process] { return process.Readings(); });
            std::string why;
            started = metrics->Serve(process.Options().metrics, &why);
            if (started) {
                Logger::Put(11, nullptr, "main", 0, "metrics at http://%s/metrics",
                            process.Options().metrics.c_str());
            } else {
                Logger::Put(4, nullptr, "main", 0, "%s", why.c_str());
            }
        }
        if (!started) {
            Logger::Put(11, nullptr, "main", 0, "Initialize Error.");
            Logger::Put(4, nullptr, "main", 0, "%s --help lists the options, with an example",
                        kProgram);
            // 32768 would read as 0 in an 8-bit Linux exit status: report failure as 1.
            exitCode = kExitStartFailed;
        } else {
            process.Execute();
            const auto outcome = process.RunOutcome();
            if (outcome.status != kExitNormal) {
                Logger::Put(4, nullptr, "main", 0, "%s", outcome.why.c_str());
            }
            exitCode = outcome.status;
            Logger::Put(11, nullptr, "main", 0, "Call Uninitialize.");
            process.Uninitialize();
        }
    }
    return exitCode;
}
