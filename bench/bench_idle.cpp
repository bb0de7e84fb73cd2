// CPU used by a connected recorder that receives nothing, and by one that receives a steady
// 30 fps stream with audio, over wall-clock seconds. Prints figures; not a test.
#include <time.h>

#include <chrono>
#include <cstdio>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "platform/framework/ReceivedSample.h"
#include "platform/logger/Logger.h"
#include "platform/transfer/FileTransfer.h"
#include "src/FileRecorderModule.h"
#include "src/ProcessControl.h"
#include "tests/support/TestHost.h"

namespace {

double cpuSeconds() {
    timespec ts{};
    clock_gettime(CLOCK_PROCESS_CPUTIME_ID, &ts);
    return static_cast<double>(ts.tv_sec) + static_cast<double>(ts.tv_nsec) / 1e9;
}

class NullTransfer : public IFileTransfer {
  public:
    FileTransferResult Transfer(const FileTransferRequest&, FileTransferInfo*) override {
        return Success;
    }
    void Cancel() override {}
};

std::shared_ptr<ReceivedSample> sample(uint64_t ms, bool idr) {
    SampleAttributes a;
    a.timestamp = ms;
    a.rtpTime = ms * 90;
    std::string payload = idr ? std::string("\x00\x00\x00\x01\x65\x88", 6)
                              : std::string("\x00\x00\x00\x01\x41\x9a", 6);
    payload.resize(4000, 'x');
    return MakeReceivedSample(a, payload, nullptr);
}

void measure(bool feed) {
    std::vector<std::string> args = {"bench",     "-bucketname",    "bench-idle", "-uploadinterval",
                                     "2",         "-authretrytime", "1000",       "-bufferfullsize",
                                     "5",         "-kct",           "h264",       "-status",
                                     "/dev/null", "-loglevel",      "4"};
    std::vector<char*> argv;
    for (auto& a : args) argv.push_back(a.data());
    auto host = std::make_shared<TestHost>();
    Orvane::ProcessControl process(static_cast<int>(argv.size()), argv.data());
    process.SetHost(host);
    process.Initialize();
    process.Module()->SetTransferFactory([] { return std::make_shared<NullTransfer>(); });
    process.startProcess();
    host->ConnectionReply();
    host->SetProperties(
        {{"awsAccessKey", "a"}, {"awsSecretKey", "s"}, {"sessionToken", "t"}, {"region", "r"}});
    const double seconds = 5;
    double cpu0 = cpuSeconds();
    auto start = std::chrono::steady_clock::now();
    uint64_t frame = 0;
    while (std::chrono::steady_clock::now() - start < std::chrono::duration<double>(seconds)) {
        if (feed) {
            uint64_t ms = frame * 100 / 3;
            host->Video(sample(ms, frame % 30 == 0));
            if (frame % 3 == 0) {
                for (int k = 0; k < 5; ++k) host->Audio(sample(ms + k * 20, false));
            }
            ++frame;
            std::this_thread::sleep_for(std::chrono::microseconds(33333));
        } else {
            std::this_thread::sleep_for(std::chrono::milliseconds(100));
        }
    }
    double cpu = cpuSeconds() - cpu0;
    std::printf("%-40s %8.3f ms CPU per wall second\n",
                feed ? "connected, 30 fps video + audio" : "connected, idle (no samples)",
                cpu * 1000 / seconds);
    host->Disconnection();
    process.stopProcess();
}

}  // namespace

int main() {
    Logger::SetLevel(4);
    measure(false);
    measure(true);
    return 0;
}
