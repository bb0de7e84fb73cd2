// ProcessReadings: what a running recorder process counts about itself, read at once for
// monitoring (BaseProcess::Readings). A plain value: every count is a total since the process
// started, so a reader that misses a reading loses nothing.
#pragma once

#include <cstdint>
#include <map>
#include <string>

#include "platform/framework/VqResult.h"

struct ProcessReadings {
    // The media of the sample counts below, in this order.
    enum Media { kVideo, kAudio, kMeta, kMediaCount };

    VqProcessState state = Initializing;  // the process state and its code, as last set
    unsigned int code = 0;
    // Stream files done, by result: "Success" for a stored one, else the name of why it was
    // given up ("NetworkError", "BufferOver", ...; "Unnamed" when none was given).
    std::map<std::string, uint64_t> files;
    uint64_t samplesReceived[kMediaCount] = {0, 0, 0};  // handed to the module's queues
    uint64_t queueOverflows[kMediaCount] = {0, 0, 0};   // of those, refused for a full queue
    uint64_t fileBufferMs = 0;       // ms of stream in finished files waiting for the store
    uint64_t fileBufferLimitMs = 0;  // the level at which files are given up; 0 before known
    uint64_t inputReopenings = 0;    // a live input opened again after it failed or fell silent
    uint64_t clockRebases = 0;       // jumps of the source's clock re-based
};
