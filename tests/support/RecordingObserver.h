// RecordingObserver: an INotifyObserver that keeps the process state like the framework does
// and records every call. Thread-safe: every member is guarded by mutex_, and the getters
// return copies.
#pragma once

#include <functional>
#include <map>
#include <mutex>
#include <string>
#include <vector>

#include "src/INotifyObserver.h"
#include "tests/support/Guarded.h"

namespace testsupport {

class RecordingObserver : public Orvane::INotifyObserver, private Guarded {
  public:
    VqResult notifyGetAWSTokenRequest(GetAWSSecureTokenRequest& request) override;
    VqResult notifyLastSequenceNumNotify(LastSequenceNumNotify& message) override;
    void notifyModuleError(unsigned int code) override { Note(errors_, Error, code); }
    void notifyModuleWarn(unsigned int code) override { Note(warnings_, Warning, code); }
    void notifyModuleExecute() override { Note(executes_, Executing, 0); }
    VqProcessState GetModuleStatus() override { return State(); }
    void notifyTransmissionStatus(const std::map<std::string, std::string>& entries) override;

    // Runs on every token request, outside the lock (e.g. to deliver credentials).
    void OnTokenRequest(std::function<void()> action) { Set(tokenAction_, std::move(action)); }
    void SetState(VqProcessState state) { Set(state_, state); }

    size_t TokenRequests() const { return Get(tokenRequests_); }
    std::vector<SequenceEntry> Entries() const { return Get(entries_); }
    // The "UploadInfo" values, in order.
    std::vector<std::string> UploadInfos() const { return Get(uploadInfos_); }
    std::vector<unsigned> Warnings() const { return Get(warnings_); }
    std::vector<unsigned> Errors() const { return Get(errors_); }
    size_t ExecuteCalls() const { return Get(executes_).size(); }
    VqProcessState State() const { return Get(state_); }

  private:
    // Records a state notification in `calls` and takes on its state.
    void Note(std::vector<unsigned>& calls, VqProcessState state, unsigned code) {
        std::lock_guard<std::mutex> lock(mutex_);
        calls.push_back(code);
        state_ = state;
    }

    std::function<void()> tokenAction_;
    size_t tokenRequests_ = 0;
    std::vector<SequenceEntry> entries_;
    std::vector<std::string> uploadInfos_;
    std::vector<unsigned> warnings_;
    std::vector<unsigned> errors_;
    std::vector<unsigned> executes_;  // one 0 per notifyModuleExecute
    VqProcessState state_ = Executing;
};

}  // namespace testsupport
