// TestHost: a host driven by a test. The test delivers the host's messages and samples
// through it and reads back everything the module sent.
//
// Run blocks until Finish() is called, so a test can run Execute on a thread of its own and
// drive the module meanwhile. All members are thread-safe.
#pragma once

#include <condition_variable>
#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "platform/framework/BaseProcess.h"

class TestHost : public IModuleHost {
  public:
    struct StatusChange {
        VqProcessState state;
        unsigned int code;
    };

    bool Prepare(BaseProcess& process) override;
    void Run(BaseProcess& process) override;
    void Finish();  // makes Run return

    // Deliveries to the module (on the caller's thread). Valid after Prepare.
    VqResult ConnectionReply();
    VqResult Disconnection();
    bool SetProperties(std::map<std::string, std::string> properties);
    void Video(std::shared_ptr<ReceivedSample> sample);
    void Audio(std::shared_ptr<ReceivedSample> sample);
    void Meta(std::shared_ptr<ReceivedSample> sample);

    // Called for every token request, after it was recorded (e.g. to answer it).
    void OnTokenRequestDo(std::function<void(const GetAWSSecureTokenRequest&)> action);

    std::vector<GetAWSSecureTokenRequest> TokenRequests() const;
    std::vector<LastSequenceNumNotify> SequenceNotifies() const;
    std::vector<TransferStatusNotify> TransmissionStatuses() const;
    std::vector<StatusChange> StatusChanges() const;

    // Waits up to `timeoutMs` until `predicate` holds; re-checked after every message.
    bool WaitFor(const std::function<bool()>& predicate, int timeoutMs) const;

    void OnTokenRequest(const GetAWSSecureTokenRequest& m) override;
    void OnLastSequenceNumNotify(const LastSequenceNumNotify& m) override;
    void OnTransmissionStatus(const TransferStatusNotify& m) override;
    void OnProcessStatus(VqProcessState state, unsigned int code) override;

  private:
    BaseProcess* process() const;

    mutable std::mutex mutex_;
    mutable std::condition_variable changed_;
    BaseProcess* process_ = nullptr;  // set by Prepare; not owned
    bool finished_ = false;
    uint64_t generation_ = 0;  // raised by every message the module sends
    std::function<void(const GetAWSSecureTokenRequest&)> tokenAction_;
    std::vector<GetAWSSecureTokenRequest> tokenRequests_;
    std::vector<LastSequenceNumNotify> sequenceNotifies_;
    std::vector<TransferStatusNotify> transmissionStatuses_;
    std::vector<StatusChange> statusChanges_;
};
