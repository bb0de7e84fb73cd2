#include "tests/support/TestHost.h"

#include <chrono>

bool TestHost::Prepare(BaseProcess& process) {
    std::lock_guard<std::mutex> lock(mutex_);
    process_ = &process;
    return true;
}

void TestHost::Run(BaseProcess&) {
    std::unique_lock<std::mutex> lock(mutex_);
    changed_.wait(lock, [this] { return finished_; });
}

void TestHost::Finish() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        finished_ = true;
    }
    changed_.notify_all();
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

void TestHost::OnTokenRequestDo(std::function<void(const GetAWSSecureTokenRequest&)> action) {
    std::lock_guard<std::mutex> lock(mutex_);
    tokenAction_ = std::move(action);
}

void TestHost::OnTokenRequest(const GetAWSSecureTokenRequest& m) {
    std::function<void(const GetAWSSecureTokenRequest&)> action;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        tokenRequests_.push_back(m);
        ++generation_;
        action = tokenAction_;
    }
    changed_.notify_all();
    if (action) action(m);
}

void TestHost::OnLastSequenceNumNotify(const LastSequenceNumNotify& m) {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        sequenceNotifies_.push_back(m);
        ++generation_;
    }
    changed_.notify_all();
}

void TestHost::OnTransmissionStatus(const TransferStatusNotify& m) {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        transmissionStatuses_.push_back(m);
        ++generation_;
    }
    changed_.notify_all();
}

void TestHost::OnProcessStatus(VqProcessState state, unsigned int code) {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        statusChanges_.push_back({state, code});
        ++generation_;
    }
    changed_.notify_all();
}

std::vector<GetAWSSecureTokenRequest> TestHost::TokenRequests() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return tokenRequests_;
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

bool TestHost::WaitFor(const std::function<bool()>& predicate, int timeoutMs) const {
    auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    std::unique_lock<std::mutex> lock(mutex_);
    while (true) {
        uint64_t seen = generation_;
        lock.unlock();
        bool done = predicate();
        lock.lock();
        if (done) return true;
        // A message that came while the predicate ran bumped the generation: look again.
        if (!changed_.wait_until(lock, deadline, [&] { return generation_ != seen; })) {
            lock.unlock();
            return predicate();
        }
    }
}
