#include "tests/support/RecordingObserver.h"

namespace testsupport {

VqResult RecordingObserver::notifyGetAWSTokenRequest(GetAWSSecureTokenRequest&) {
    std::function<void()> action;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        ++tokenRequests_;
        action = tokenAction_;
    }
    if (action) action();
    return VQ_OK;
}

VqResult RecordingObserver::notifyLastSequenceNumNotify(LastSequenceNumNotify& message) {
    std::lock_guard<std::mutex> lock(mutex_);
    entries_.insert(entries_.end(), message.entries.begin(), message.entries.end());
    return VQ_OK;
}

void RecordingObserver::notifyTransmissionStatus(
    const std::map<std::string, std::string>& entries) {
    std::lock_guard<std::mutex> lock(mutex_);
    auto it = entries.find("UploadInfo");
    if (it != entries.end()) uploadInfos_.push_back(it->second);
}

}  // namespace testsupport
