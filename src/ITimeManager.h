// ITimeManager: the pipeline's millisecond tick source. Elapsed times are differences of two
// readings in unsigned 32-bit arithmetic, right across one wrap. Any thread, never blocks.
#pragma once

#include <cstdint>

namespace Orvane {

class ITimeManager {
  public:
    virtual uint32_t GetTime() = 0;  // ms, wraps after 2^32
    virtual ~ITimeManager() = default;
};

}  // namespace Orvane
