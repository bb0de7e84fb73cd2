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
    for (const auto& e : message.entries) entries_.push_back(e);
    return VQ_OK;
}

void RecordingObserver::notifyModuleError(unsigned int code) {
    std::lock_guard<std::mutex> lock(mutex_);
    errors_.push_back(code);
    state_ = Error;
    code_ = code;
}

void RecordingObserver::notifyModuleWarn(unsigned int code) {
    std::lock_guard<std::mutex> lock(mutex_);
    warnings_.push_back(code);
    state_ = Warning;
    code_ = code;
}

void RecordingObserver::notifyModuleExecute() {
    std::lock_guard<std::mutex> lock(mutex_);
    ++executeCalls_;
    state_ = Executing;
    code_ = 0;
}

VqProcessState RecordingObserver::GetModuleStatus() {
    std::lock_guard<std::mutex> lock(mutex_);
    return state_;
}

void RecordingObserver::notifyTransmissionStatus(
    const std::map<std::string, std::string>& entries) {
    std::lock_guard<std::mutex> lock(mutex_);
    auto it = entries.find("UploadInfo");
    if (it != entries.end()) uploadInfos_.push_back(it->second);
}

void RecordingObserver::OnTokenRequest(std::function<void()> action) {
    std::lock_guard<std::mutex> lock(mutex_);
    tokenAction_ = std::move(action);
}

size_t RecordingObserver::TokenRequests() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return tokenRequests_;
}

std::vector<SequenceEntry> RecordingObserver::Entries() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return entries_;
}

std::vector<std::string> RecordingObserver::UploadInfos() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return uploadInfos_;
}

std::vector<unsigned> RecordingObserver::Warnings() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return warnings_;
}

std::vector<unsigned> RecordingObserver::Errors() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return errors_;
}

size_t RecordingObserver::ExecuteCalls() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return executeCalls_;
}

VqProcessState RecordingObserver::State() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return state_;
}

unsigned RecordingObserver::Code() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return code_;
}

void RecordingObserver::SetState(VqProcessState state, unsigned code) {
    std::lock_guard<std::mutex> lock(mutex_);
    state_ = state;
    code_ = code;
}

}  // namespace testsupport
