// RecordingObserver: an INotifyObserver that keeps the process state like the framework does
// and records every call. Thread-safe.
#pragma once

#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "src/INotifyObserver.h"

namespace testsupport {

class RecordingObserver : public Orvane::INotifyObserver {
  public:
    VqResult notifyGetAWSTokenRequest(GetAWSSecureTokenRequest& request) override;
    VqResult notifyLastSequenceNumNotify(LastSequenceNumNotify& message) override;
    void notifyModuleError(unsigned int code) override;
    void notifyModuleWarn(unsigned int code) override;
    void notifyModuleExecute() override;
    VqProcessState GetModuleStatus() override;
    void notifyTransmissionStatus(const std::map<std::string, std::string>& entries) override;

    // Runs on every token request (e.g. to deliver credentials).
    void OnTokenRequest(std::function<void()> action);

    size_t TokenRequests() const;
    std::vector<SequenceEntry> Entries() const;
    std::vector<std::string> UploadInfos() const;  // the "UploadInfo" values in order
    std::vector<unsigned> Warnings() const;
    std::vector<unsigned> Errors() const;
    size_t ExecuteCalls() const;
    VqProcessState State() const;
    unsigned Code() const;
    void SetState(VqProcessState state, unsigned code);

  private:
    mutable std::mutex mutex_;
    std::function<void()> tokenAction_;
    size_t tokenRequests_ = 0;
    std::vector<SequenceEntry> entries_;
    std::vector<std::string> uploadInfos_;
    std::vector<unsigned> warnings_;
    std::vector<unsigned> errors_;
    size_t executeCalls_ = 0;
    VqProcessState state_ = Executing;
    unsigned code_ = 0;
};

}  // namespace testsupport
