// IDataController: owns the upload thread that takes stream files out of the file buffer and
// uploads, retries, gives up or drops them, reporting each to the host.
#pragma once

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
};

}  // namespace Orvane
