// BaseProcess: the module framework's process skeleton that a module process derives from.
//
// Lifecycle (one thread, the "message thread", calls these in order):
//   constructor  reads the framework's log options so that the first log line already goes
//                where the user asked;
//   Initialize() reads the framework's options, calls initializeProcess (the module's own
//                options come first), checks that the command line holds only known options
//                with values, opens the status output, then prepares the host; false if any
//                step fails;
//   Execute()    startProcess, then the host's Run (connection reply, credentials, samples),
//                then the disconnection request and stopProcess;
//   Uninitialize().
// RunOutcome() then tells how the run ended, as the process's exit status.
// Hooks are virtual and public so that a host (and a test) can deliver messages. The sample
// hooks are called on the host's receive threads, concurrently with the message hooks.
// Status and send calls are safe for concurrent callers.
#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include "platform/framework/FrameworkOptions.h"
#include "platform/framework/ModuleHost.h"
#include "platform/framework/ProcessReadings.h"
#include "platform/framework/ReceivedSample.h"
#include "platform/framework/StatusWriter.h"
#include "platform/framework/VqMessages.h"
#include "platform/framework/VqResult.h"

// The process's exit statuses.
enum ExitStatus : int {
    kExitNormal = 0,
    kExitStartFailed = 1,    // Initialize failed: options, input, store settings
    kExitModuleError = 2,    // the module reported the error state
    kExitNothingStored = 3,  // stream files were given up and none was stored
};

// What the host learnt of the input once it is open, for BaseProcess::checkInput.
struct InputInfo {
    std::string videoCodec;  // "H.264" or "H.265"
};

class IVqModuleMessageObserver {
  public:
    virtual ~IVqModuleMessageObserver() = default;
};

class IReceiveStreamObserver {
  public:
    virtual ~IReceiveStreamObserver() = default;
    virtual void notifyVideoData(std::shared_ptr<ReceivedSample> sample) = 0;
    virtual void notifyAudioData(std::shared_ptr<ReceivedSample> sample) = 0;
    virtual void notifyMetaData(std::shared_ptr<ReceivedSample> sample) = 0;
};

class ISendStreamObserver {
  public:
    virtual ~ISendStreamObserver() = default;
};

class IStreamDataSender {
  public:
    virtual ~IStreamDataSender() = default;
};

class BaseProcess : public IVqModuleMessageObserver,
                    public IReceiveStreamObserver,
                    public ISendStreamObserver,
                    public IStreamDataSender {
  public:
    BaseProcess(int argc, char** argv, bool, bool);
    ~BaseProcess() override;
    BaseProcess(const BaseProcess&) = delete;
    BaseProcess& operator=(const BaseProcess&) = delete;

    bool Initialize();
    bool Execute();
    void Uninitialize();

    // How the run ended, after Execute: kExitModuleError when the process state is Error,
    // kExitNothingStored when the module gave stream files up and stored none, else
    // kExitNormal; `why` says so in one line ("" for a normal run).
    struct Outcome {
        ExitStatus status = kExitNormal;
        std::string why;
    };
    Outcome RunOutcome();

    // Installs the host that Initialize prepares and Execute runs; without one, Initialize
    // creates the media host for -input (CreateMediaHost). Call before Initialize.
    void SetHost(std::shared_ptr<IModuleHost> host);

    // `-name value` readers. GetArgument_int: false when the value is not a whole number in
    // int range; the two trailing parameters (minimum digits, base) are accepted and ignored.
    bool GetArgument_str(std::string name, std::string& value, std::string defaultValue);
    bool GetArgument_int(std::string name, int& value, int, int);
    std::string GetStreamingId();
    std::string getParentStreamName();
    const FrameworkOptions& Options() const { return options_; }

    // The process's counts for monitoring: its state, the stream files done by result, and what
    // the host (AddReadings) and the module (moduleReadings) count. Any thread; takes the
    // process's lock briefly. Valid before Initialize and after Uninitialize too (the parts of
    // a host that is gone read 0).
    ProcessReadings Readings();

    void SetProcessStatus(VqProcessState state, unsigned int code);
    VqProcessState GetProcessStatus();
    unsigned int GetProcessStatusCode();

    VqResult SendTransmissionStatus(const std::string& destination, TransferStatusNotify& message);
    VqResult SendGetAWSTokenRequest(const std::string& destination,
                                    GetAWSSecureTokenRequest& message);
    VqResult SendLastSequenceNumNotify(const std::string& destination,
                                       LastSequenceNumNotify& message);

    // Message hooks (message thread).
    virtual VqResult notifyModuleConnectionRequestReply(ConnectResponse& reply);
    virtual VqResult notifyInputOutputDisconnectionRequest(DisconnectInputRequest& request);
    virtual VqResult notifyGetAWSTokenRequest(GetAWSSecureTokenRequest& request);
    virtual VqResult notifyLastSequenceNumNotify(LastSequenceNumNotify& message);
    virtual VqResult notifyTransmissionStatus(TransferStatusNotify& message);
    virtual bool initializeProcess(std::string parameter);
    virtual void stopProcess();
    virtual bool startProcess();
    virtual bool setProperties(std::map<std::string, std::string>& properties);
    // End of stream (the host's message thread): the input ended or the user asked to stop.
    // The module stores what it still holds, waiting at most `timeoutMs`; true when all was
    // stored in time. The host then delivers the disconnection request as usual. The base
    // has nothing to store and returns true at once.
    virtual bool drainProcess(int64_t timeoutMs);
    // The module's own options, for the usage text and the check for unknown options. Called
    // on any thread, at any time; the base has none.
    virtual std::vector<OptionHelp> moduleOptions() const;
    // The host opened the input (message thread, during Initialize): false, after a log line
    // that says why, when the module cannot record it. The base accepts every input.
    virtual bool checkInput(const InputInfo& input);

    // Flow control for an input that can wait (a file), on the receive thread before it hands
    // samples over: blocks until the module can take `video`, `audio` and `meta` more samples
    // without dropping one, or until `deadline`; true when it can. A live input never calls
    // it. The base drops every sample and returns true at once.
    virtual bool waitForSampleRoom(size_t video, size_t audio, size_t meta,
                                   std::chrono::steady_clock::time_point deadline);

    // Receive thread: the samples handed over between these two calls come as one burst, so
    // the module may wake its workers once, at the end, rather than per sample. Every begin is
    // followed by an end. The base does nothing.
    virtual void beginSampleBurst() {}
    virtual void endSampleBurst() {}

    // Adds what the module counts (queues, file buffer) to `readings`. Any thread, concurrently
    // with every other hook, after Initialize; must not block. The base counts nothing.
    virtual void moduleReadings(ProcessReadings& readings);

    // Sample hooks (receive threads): the base drops the samples.
    void notifyVideoData(std::shared_ptr<ReceivedSample>) override {}
    void notifyAudioData(std::shared_ptr<ReceivedSample>) override {}
    void notifyMetaData(std::shared_ptr<ReceivedSample>) override {}

  private:
    std::shared_ptr<IModuleHost> hostSnapshot();

    CommandLine commandLine_;
    FrameworkOptions options_;
    std::vector<std::string> optionErrors_;  // framework options that could not be read
    StatusWriter status_;

    std::mutex mutex_;  // guards host_, state_, code_ and the counts below
    std::shared_ptr<IModuleHost> host_;
    VqProcessState state_ = Initializing;
    unsigned int code_ = 0;
    uint64_t storedFiles_ = 0;   // sequence entries that succeeded
    uint64_t givenUpFiles_ = 0;  // sequence entries that did not
    std::string lastError_;      // errorName of the last entry given up, BufferOver last
    std::map<std::string, uint64_t> filesByResult_;  // "Success" or the errorName given
};

// Creates the host that records `options.input`; null (with a log line saying why) when the
// input cannot be handled by this build.
std::shared_ptr<IModuleHost> CreateMediaHost(const FrameworkOptions& options);
