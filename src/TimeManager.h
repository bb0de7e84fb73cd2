// TimeManager: CLOCK_MONOTONIC in milliseconds, cut to 32 bits. Stateless.
#pragma once

#include "src/ITimeManager.h"

namespace Orvane {

class TimeManager : public ITimeManager {
  public:
    uint32_t GetTime() override;
};

}  // namespace Orvane
