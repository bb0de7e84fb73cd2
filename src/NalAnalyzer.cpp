#include "src/NalAnalyzer.h"

namespace Orvane {

NalAnalyzer::NalAnalyzer(const int& codecType)
    : analyzer_(std::make_shared<nal_access::StreamAnalyzer>()) {
    auto analyzer = analyzer_.get();
    if (codecType == 1) {
        isIdr_ = [analyzer](const std::shared_ptr<StreamData>& s) {
            return analyzer->IsIDR_H265(s);
        };
    } else {
        isIdr_ = [analyzer](const std::shared_ptr<StreamData>& s) { return analyzer->IsIDR(s); };
    }
}

NalAnalyzer::~NalAnalyzer() {
    isIdr_ = nullptr;
    analyzer_.reset();
}

bool NalAnalyzer::IsIDR(const std::shared_ptr<StreamData>& sample) {
    return isIdr_(sample);
}

}  // namespace Orvane
