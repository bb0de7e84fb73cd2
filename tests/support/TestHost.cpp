#include "tests/support/TestHost.h"

bool TestHost::Prepare(BaseProcess& process) {
    std::lock_guard<std::mutex> lock(mutex_);
    process_ = &process;
    return true;
}

BaseProcess* TestHost::process() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return process_;
}

VqResult TestHost::ConnectionReply() {
    ConnectResponse reply;
    return process()->notifyModuleConnectionRequestReply(reply);
}

VqResult TestHost::Disconnection() {
    DisconnectInputRequest request;
    return process()->notifyInputOutputDisconnectionRequest(request);
}

bool TestHost::SetProperties(std::map<std::string, std::string> properties) {
    return process()->setProperties(properties);
}

void TestHost::Video(std::shared_ptr<ReceivedSample> sample) {
    process()->notifyVideoData(std::move(sample));
}

void TestHost::Audio(std::shared_ptr<ReceivedSample> sample) {
    process()->notifyAudioData(std::move(sample));
}

void TestHost::Meta(std::shared_ptr<ReceivedSample> sample) {
    process()->notifyMetaData(std::move(sample));
}

void TestHost::OnLastSequenceNumNotify(const LastSequenceNumNotify& m) {
    std::lock_guard<std::mutex> lock(mutex_);
    sequenceNotifies_.push_back(m);
}

void TestHost::OnTransmissionStatus(const TransferStatusNotify& m) {
    std::lock_guard<std::mutex> lock(mutex_);
    transmissionStatuses_.push_back(m);
}

void TestHost::OnProcessStatus(VqProcessState state, unsigned int code) {
    std::lock_guard<std::mutex> lock(mutex_);
    statusChanges_.push_back({state, code});
}

std::vector<LastSequenceNumNotify> TestHost::SequenceNotifies() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return sequenceNotifies_;
}

std::vector<TransferStatusNotify> TestHost::TransmissionStatuses() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return transmissionStatuses_;
}

std::vector<TestHost::StatusChange> TestHost::StatusChanges() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return statusChanges_;
}
