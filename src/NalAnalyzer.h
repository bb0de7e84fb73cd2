// NalAnalyzer: the IDR test for the configured codec, chosen once at construction
// (codecType 1: H.265; any other value: H.264). Takes no lock; concurrent calls are safe.
#pragma once

#include <functional>
#include <memory>

#include "platform/nal/StreamAnalyzer.h"
#include "src/INalAnalyzer.h"

namespace Orvane {

class NalAnalyzer : public INalAnalyzer {
  public:
    explicit NalAnalyzer(const int& codecType);
    ~NalAnalyzer() override;
    bool IsIDR(const std::shared_ptr<StreamData>& sample) override;

  private:
    std::shared_ptr<nal_access::StreamAnalyzer> analyzer_;
    std::function<bool(const std::shared_ptr<StreamData>&)> isIdr_;  // the chosen test
};

}  // namespace Orvane
