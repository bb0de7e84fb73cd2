// Process entry: one ProcessControl, the framework's message loop, the exit status.
#include "platform/logger/Logger.h"
#include "src/ProcessControl.h"

int main(int argc, char** argv) {
    int exitCode = 0;
    {
        Orvane::ProcessControl process(argc, argv);
        Logger::Put(6, nullptr, "main", 0, "VQ-VERSION:%s", "1.21.0.03290");
        if (!process.Initialize()) {
            Logger::Put(11, nullptr, "main", 0, "Initialize Error.");
            // 32768 would read as 0 in an 8-bit Linux exit status: report failure as 1.
            exitCode = 1;
        } else {
            process.Execute();
            Logger::Put(11, nullptr, "main", 0, "Call Uninitialize.");
            process.Uninitialize();
        }
    }
    return exitCode;
}
