// IDataController: owns the upload thread that takes stream files out of the file buffer and
// uploads, retries, gives up or drops them, reporting each to the host.
#pragma once

#include <chrono>
#include <cstdint>

#include "src/AwsInfo.h"

namespace Orvane {

class IDataController {
  public:
    virtual void Start() = 0;  // once per controller
    // Cancels a running transfer, wakes every wait and joins the upload thread. Safe to call
    // again or before Start.
    virtual void Stop() = 0;
    // Latest credentials from the host (message thread); wakes a thread waiting for them.
    virtual void SetAwsInfo(AwsInfo info) = 0;
    virtual ~IDataController() = default;

    // End of stream. Waits until `files` stream files have left the buffer for good
    // (uploaded, refused, given up or dropped, each reported), the upload thread ended, the
    // controller was stopped, or `deadline` passed; true when the files are done.
    virtual bool WaitForFiles(uint64_t files, std::chrono::steady_clock::time_point deadline) = 0;
    // Stream files done so far (see WaitForFiles).
    virtual uint64_t FilesDone() = 0;
    // ms of stream not yet done: the buffer's count plus the file in hand.
    virtual uint64_t PendingMs() = 0;
    // True while the store refuses or fails: the last transfer attempt did not succeed. Any
    // thread.
    virtual bool StoreFailing() = 0;
};

}  // namespace Orvane
