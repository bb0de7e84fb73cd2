// INalAnalyzer: does this video sample hold an IDR picture? Safe to call concurrently (the
// video worker and the filing thread both call it).
#pragma once

#include <memory>

#include "platform/framework/StreamData.h"

namespace Orvane {

class INalAnalyzer {
  public:
    virtual ~INalAnalyzer() = default;
    virtual bool IsIDR(const std::shared_ptr<StreamData>& sample) = 0;
};

}  // namespace Orvane
