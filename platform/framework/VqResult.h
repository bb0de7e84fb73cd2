// Result and process-state values of the module framework.
#pragma once

#include <cstdint>

// Result of a framework message call. The recorder passes it on and never tests it.
enum VqResult : int32_t {
    VQ_OK = 0,
    VQ_FAIL = -1,
};

// Process state as reported to the host. Only 4, 6 and 7 are set by the recorder.
enum VqProcessState : int32_t {
    Initializing = 1,
    Initialized = 2,
    Starting = 3,
    Executing = 4,
    Stopping = 5,
    Warning = 6,
    Error = 7,
};
