// ModuleSettings: the recorder's settings, read once from the command line by ProcessControl
// and copied by value into the module, the stream buffer and the data controller.
#pragma once

#include <cstdint>
#include <string>

namespace Orvane {

struct ModuleSettings {
    std::string bucketName;       // S3 bucket that receives the stream files
    std::string streamingId;      // the framework's id of the stream
    int32_t uploadInterval = 0;   // seconds of stream per stream file; wait after a network error
    int32_t authRetryTime = 0;    // ms to wait for credentials after a token request
    int32_t bufferFullSize = 0;   // upload intervals of stream the file buffer may hold
    uint32_t codecType = 0;       // 0 H.264, 1 H.265
    bool s3Accel = false;         // use S3 transfer acceleration
    int32_t startIgnoreTime = 0;  // ms of stream to skip after the first sample
};

}  // namespace Orvane
