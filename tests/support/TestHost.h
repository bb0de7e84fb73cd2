// TestHost: a host driven by a test. The test delivers the host's messages and samples
// through it and reads back what the module sent. Run returns at once: the test drives the
// module itself. All members are thread-safe.
#pragma once

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
    void Run(BaseProcess&) override {}

    // Deliveries to the module (on the caller's thread). Valid after Prepare.
    VqResult ConnectionReply();
    VqResult Disconnection();
    bool SetProperties(std::map<std::string, std::string> properties);
    void Video(std::shared_ptr<ReceivedSample> sample);
    void Audio(std::shared_ptr<ReceivedSample> sample);
    void Meta(std::shared_ptr<ReceivedSample> sample);

    std::vector<LastSequenceNumNotify> SequenceNotifies() const;
    std::vector<TransferStatusNotify> TransmissionStatuses() const;
    std::vector<StatusChange> StatusChanges() const;

    void OnLastSequenceNumNotify(const LastSequenceNumNotify& m) override;
    void OnTransmissionStatus(const TransferStatusNotify& m) override;
    void OnProcessStatus(VqProcessState state, unsigned int code) override;

  private:
    BaseProcess* process() const;

    mutable std::mutex mutex_;
    BaseProcess* process_ = nullptr;  // set by Prepare; not owned
    std::vector<LastSequenceNumNotify> sequenceNotifies_;
    std::vector<TransferStatusNotify> transmissionStatuses_;
    std::vector<StatusChange> statusChanges_;
};
