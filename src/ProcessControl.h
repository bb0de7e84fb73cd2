// ProcessControl: the recorder's BaseProcess. Turns the framework's hooks into operations on
// the FileRecorderModule and is the INotifyObserver through which the components report.
//
// Threads: the message hooks (initializeProcess, startProcess, stopProcess, connection reply,
// disconnection request, setProperties) come on the framework's message thread; the sample
// hooks on its receive threads, concurrently; the INotifyObserver operations on the filing
// and upload threads. The running flag is the only field written while samples flow (atomic);
// the module and settings are written only by initializeProcess, before samples flow.
#pragma once

#include <atomic>
#include <map>
#include <memory>
#include <string>

#include "platform/framework/BaseProcess.h"
#include "src/INotifyObserver.h"
#include "src/ModuleSettings.h"

namespace Orvane {

class FileRecorderModule;

class ProcessControl : public BaseProcess, public INotifyObserver {
  public:
    ProcessControl(int argc, char** argv);
    ~ProcessControl() override;

    VqResult notifyModuleConnectionRequestReply(ConnectResponse& reply) override;
    VqResult notifyInputOutputDisconnectionRequest(DisconnectInputRequest& request) override;
    VqResult notifyGetAWSTokenRequest(GetAWSSecureTokenRequest& request) override;
    VqResult notifyLastSequenceNumNotify(LastSequenceNumNotify& message) override;
    bool initializeProcess(std::string parameter) override;
    void stopProcess() override;
    bool startProcess() override;
    bool setProperties(std::map<std::string, std::string>& properties) override;
    // End of stream: stores everything the module holds, with the usual upload rules, before
    // the host disconnects; what the deadline leaves is dropped by the disconnection, and the
    // log says how much.
    bool drainProcess(int64_t timeoutMs) override;
    // The seven recorder options, for the usage text.
    static std::vector<OptionHelp> RecorderOptions();
    std::vector<OptionHelp> moduleOptions() const override { return RecorderOptions(); }
    // The module's queue counts and its file buffer's level and limit.
    void moduleReadings(ProcessReadings& readings) override;
    // Refuses an input whose video codec is not the one -kct names.
    bool checkInput(const InputInfo& input) override;

    // The module's queues have room (or the module no longer runs and drops samples anyway).
    bool waitForSampleRoom(size_t video, size_t audio, size_t meta,
                           std::chrono::steady_clock::time_point deadline) override;
    void beginSampleBurst() override;
    void endSampleBurst() override;
    void notifyVideoData(std::shared_ptr<ReceivedSample> sample) override;
    void notifyAudioData(std::shared_ptr<ReceivedSample> sample) override;
    void notifyMetaData(std::shared_ptr<ReceivedSample> sample) override;

    void notifyModuleError(unsigned int code) override;
    void notifyModuleWarn(unsigned int code) override;
    void notifyModuleExecute() override;
    VqProcessState GetModuleStatus() override;
    void notifyTransmissionStatus(const std::map<std::string, std::string>& entries) override;
    using BaseProcess::notifyTransmissionStatus;

    // For tests and the host: the module (null before initializeProcess).
    std::shared_ptr<FileRecorderModule> Module() const { return module_; }
    const ModuleSettings& Settings() const { return settings_; }
    bool IsRunning() const { return running_.load(); }

  private:
    bool getArgument(ModuleSettings& settings);
    // Settings that read well but can never record: an upload interval below 1 s, a store that
    // cannot take the bucket, endpoint or keys. False after one line that says why.
    bool checkSettings(const ModuleSettings& settings);
    bool setAuthenticationInfo(const std::map<std::string, std::string>& properties);

    std::atomic<bool> running_{false};  // between startProcess and a stop, disconnection or error
    std::string streamingId_;           // put into every token request
    std::shared_ptr<FileRecorderModule> module_;
    ModuleSettings settings_;
    bool threadsStarted_ = false;  // the module's workers run (message thread only)
};

}  // namespace Orvane
