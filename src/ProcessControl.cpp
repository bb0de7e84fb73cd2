#include "src/ProcessControl.h"

#include <algorithm>
#include <cctype>
#include <chrono>

#include "platform/framework/StreamData.h"
#include "platform/logger/Logger.h"
#include "platform/transfer/StoreSettings.h"
#include "src/AwsInfo.h"
#include "src/FileRecorderModule.h"

namespace Orvane {
namespace {
constexpr const char* kFile = "src/ProcessControl";
}

ProcessControl::ProcessControl(int argc, char** argv) : BaseProcess(argc, argv, true, false) {}

ProcessControl::~ProcessControl() = default;

bool ProcessControl::getArgument(ModuleSettings& settings) {
    constexpr const char* fn = "Orvane::ProcessControl::getArgument";
    if (!GetArgument_str("-bucketname", settings.bucketName, "")) {
        Logger::Put(4, kFile, fn, __LINE__, "get bucketName fail.");
        return false;
    }
    if (!GetArgument_int("-uploadinterval", settings.uploadInterval, 0, 10)) {
        Logger::Put(4, kFile, fn, __LINE__, "get uploadInterval fail.");
        return false;
    }
    if (!GetArgument_int("-authretrytime", settings.authRetryTime, 0, 10)) {
        Logger::Put(4, kFile, fn, __LINE__, "get authRetryTime fail.");
        return false;
    }
    if (!GetArgument_int("-bufferfullsize", settings.bufferFullSize, 0, 10)) {
        Logger::Put(4, kFile, fn, __LINE__, "get bufferFUllSize fail.");
        return false;
    }
    std::string codec;
    if (!GetArgument_str("-kct", codec, "")) {
        Logger::Put(4, kFile, fn, __LINE__, "get CodecType fail.");
        return false;
    }
    settings.codecType = codec.find("264") != std::string::npos ? 0 : 1;

    std::string accel;
    if (GetArgument_str("-s3accel", accel, "")) {
        std::transform(accel.begin(), accel.end(), accel.begin(),
                       [](unsigned char c) { return static_cast<char>(std::tolower(c)); });
        settings.s3Accel = accel == "true";
    } else {
        settings.s3Accel = false;
    }

    if (!GetArgument_int("-startignoretime", settings.startIgnoreTime, 0, 10)) {
        settings.startIgnoreTime = 0;
    }
    Logger::Put(11, nullptr, nullptr, 0, "ST: start ignore time: %d [ms]",
                settings.startIgnoreTime);

    settings.streamingId = GetStreamingId();
    return true;
}

bool ProcessControl::checkSettings(const ModuleSettings& settings) {
    constexpr const char* fn = "Orvane::ProcessControl::checkSettings";
    if (settings.uploadInterval < 1) {
        Logger::Put(4, kFile, fn, __LINE__, "-uploadinterval must be at least 1 (seconds), got %d",
                    settings.uploadInterval);
        return false;
    }
    std::string why;
    if (!CheckStoreSettings(Options(), settings.bucketName, settings.streamingId, &why)) {
        Logger::Put(4, kFile, fn, __LINE__, "%s", why.c_str());
        return false;
    }
    return true;
}

std::vector<OptionHelp> ProcessControl::RecorderOptions() {
    return {
        {"bucketname", "NAME", "", "the bucket (or the directory under a file:// endpoint)"},
        {"uploadinterval", "SECONDS", "", "stream per object, at least 1"},
        {"authretrytime", "MS", "", "how long to wait for credentials after asking for them"},
        {"bufferfullsize", "N", "", "upload intervals of stream held while the store lags"},
        {"kct", "h264|h265", "", "the input's video codec"},
        {"s3accel", "true|false", "false", "use S3 transfer acceleration"},
        {"startignoretime", "MS", "0", "stream skipped after the first sample"},
    };
}

bool ProcessControl::checkInput(const InputInfo& input) {
    const char* expected = settings_.codecType == 0 ? "H.264" : "H.265";
    if (input.videoCodec == expected) return true;
    std::string kct;
    GetArgument_str("-kct", kct, "");
    Logger::Put(4, kFile, "Orvane::ProcessControl::checkInput", __LINE__,
                "-kct %s but the input's video is %s", kct.c_str(), input.videoCodec.c_str());
    return false;
}

void ProcessControl::moduleReadings(ProcessReadings& readings) {
    // module_ is replaced only by initializeProcess, which runs before any reader starts.
    if (!module_) return;
    const Module::QueueCounts counts = module_->Counts();
    for (int media = 0; media < ProcessReadings::kMediaCount; ++media) {
        readings.samplesReceived[media] = counts.received[media];
        readings.queueOverflows[media] = counts.overflows[media];
    }
    module_->FileBufferLevel(&readings.fileBufferMs, &readings.fileBufferLimitMs);
}

bool ProcessControl::initializeProcess(std::string) {
    // A module whose workers run is never dropped: replacing it would destroy running threads.
    if (module_ && threadsStarted_) {
        Logger::Put(4, kFile, "Orvane::ProcessControl::initializeProcess", __LINE__,
                    "initializeProcess while the module runs: the running module is kept.");
        return false;
    }
    if (!getArgument(settings_) || !checkSettings(settings_)) return false;
    streamingId_ = settings_.streamingId;
    if (module_) module_->OnStop();  // a stopped module may still have a connected pipeline
    module_ = std::make_shared<FileRecorderModule>();
    return module_->Initialize(std::shared_ptr<void>());
}

bool ProcessControl::startProcess() {
    module_->OnStart();
    module_->StartThreads();
    threadsStarted_ = true;
    running_ = true;
    return true;
}

void ProcessControl::stopProcess() {
    running_ = false;
    if (!module_) return;
    module_->StopThreads();
    threadsStarted_ = false;
    module_->OnStop();
}

VqResult ProcessControl::notifyModuleConnectionRequestReply(ConnectResponse& reply) {
    if (running_.load()) {
        module_->Connect(this, settings_);
    } else {
        notifyModuleError(2);
        Logger::Put(4, kFile, "Orvane::ProcessControl::notifyModuleConnectionRequestReply",
                    __LINE__, "second connection request received. change module status error");
    }
    return BaseProcess::notifyModuleConnectionRequestReply(reply);
}

VqResult ProcessControl::notifyInputOutputDisconnectionRequest(DisconnectInputRequest& request) {
    if (module_) module_->Disconnect();
    running_ = false;
    return BaseProcess::notifyInputOutputDisconnectionRequest(request);
}

bool ProcessControl::drainProcess(int64_t timeoutMs) {
    constexpr const char* fn = "Orvane::ProcessControl::drainProcess";
    Logger::Put(11, kFile, fn, __LINE__, "drainProcess enter.");
    auto deadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
    bool complete = true;
    if (!running_.load() || !module_) {
        Logger::Put(11, kFile, fn, __LINE__, "nothing to drain: the module is not running.");
    } else {
        auto result = module_->Drain(deadline);
        complete = result.complete;
        if (!complete) {
            Logger::Put(5, kFile, fn, __LINE__,
                        "drain incomplete after %lld ms: %llu stream files (%llu ms of stream) "
                        "left to the disconnection, which drops them.",
                        static_cast<long long>(timeoutMs),
                        static_cast<unsigned long long>(result.droppedFiles),
                        static_cast<unsigned long long>(result.droppedMs));
        }
    }
    Logger::Put(11, kFile, fn, __LINE__, "drainProcess exit.");
    return complete;
}

bool ProcessControl::waitForSampleRoom(size_t video, size_t audio, size_t meta,
                                       std::chrono::steady_clock::time_point deadline) {
    if (!running_.load()) return true;
    return module_->WaitForRoom(video, audio, meta, deadline) && module_->WaitForBacklog(deadline);
}

// module_ is replaced only by initializeProcess, before the receive thread starts.
void ProcessControl::beginSampleBurst() {
    if (module_) module_->BeginBurst();
}

void ProcessControl::endSampleBurst() {
    if (module_) module_->EndBurst();
}

void ProcessControl::notifyVideoData(std::shared_ptr<ReceivedSample> sample) {
    auto data = std::make_shared<StreamData>(std::move(sample));
    if (running_.load()) module_->PushVideo(std::move(data));
}

void ProcessControl::notifyAudioData(std::shared_ptr<ReceivedSample> sample) {
    auto data = std::make_shared<StreamData>(std::move(sample));
    if (running_.load()) module_->PushAudio(std::move(data));
}

void ProcessControl::notifyMetaData(std::shared_ptr<ReceivedSample> sample) {
    auto data = std::make_shared<StreamData>(std::move(sample));
    if (running_.load()) module_->PushMeta(std::move(data));
}

VqResult ProcessControl::notifyGetAWSTokenRequest(GetAWSSecureTokenRequest& request) {
    constexpr const char* fn = "Orvane::ProcessControl::notifyGetAWSTokenRequest";
    Logger::Put(11, kFile, fn, __LINE__, "notifyGetAWSTokenRequest enter.");
    request.streamingId = streamingId_;
    VqResult result = SendGetAWSTokenRequest(getParentStreamName(), request);
    Logger::Put(11, kFile, fn, __LINE__, "notifyGetAWSTokenRequest exit.");
    return result;
}

VqResult ProcessControl::notifyLastSequenceNumNotify(LastSequenceNumNotify& message) {
    constexpr const char* fn = "Orvane::ProcessControl::notifyLastSequenceNumNotify";
    Logger::Put(12, kFile, fn, __LINE__, "notifyLastSequenceNumNotify enter.");
    VqResult result = SendLastSequenceNumNotify(getParentStreamName(), message);
    Logger::Put(12, kFile, fn, __LINE__, "notifyLastSequenceNumNotify exit.");
    return result;
}

bool ProcessControl::setProperties(std::map<std::string, std::string>& properties) {
    constexpr const char* fn = "Orvane::ProcessControl::setProperties";
    Logger::Put(11, kFile, fn, __LINE__, "setProperties enter.");
    if (setAuthenticationInfo(properties)) {
        Logger::Put(11, kFile, fn, __LINE__, "setProperties exit.");
        return true;
    }
    Logger::Put(11, kFile, fn, __LINE__, "setProperties exit. not set property.");
    return false;
}

bool ProcessControl::setAuthenticationInfo(const std::map<std::string, std::string>& properties) {
    constexpr const char* fn = "Orvane::ProcessControl::setAuthenticationInfo";
    Logger::Put(11, kFile, fn, __LINE__, "setAuthInfo enter.");
    AwsInfo info;
    // Visited in the byte-wise order of the key texts.
    const std::pair<const char*, std::string AwsInfo::*> keys[] = {
        {"awsAccessKey", &AwsInfo::accessKey},
        {"awsSecretKey", &AwsInfo::secretKey},
        {"region", &AwsInfo::region},
        {"sessionToken", &AwsInfo::sessionToken},
    };
    for (const auto& [key, field] : keys) {
        auto it = properties.find(key);
        if (it == properties.end() || it->second.empty()) {
            Logger::Put(11, kFile, fn, __LINE__, "%s is empty", key);
            return false;
        }
        info.*field = it->second;
    }
    if (module_) module_->SetAwsInfo(info);
    Logger::Put(11, kFile, fn, __LINE__, "setAuth exit.");
    return true;
}

void ProcessControl::notifyModuleError(unsigned int code) {
    constexpr const char* fn = "Orvane::ProcessControl::notifyModuleError";
    Logger::Put(11, kFile, fn, __LINE__, "NotifyModuleError enter.");
    SetProcessStatus(Error, code);
    running_ = false;
    if (module_) module_->StopStreamBuffer();
    Logger::Put(11, kFile, fn, __LINE__, "NotifyModuleError exit.");
}

void ProcessControl::notifyModuleWarn(unsigned int code) {
    constexpr const char* fn = "Orvane::ProcessControl::notifyModuleWarn";
    Logger::Put(12, kFile, fn, __LINE__, "NotifyModuleWarn enter.");
    SetProcessStatus(Warning, code);
    Logger::Put(12, kFile, fn, __LINE__, "NotifyModuleWarn exit.");
}

void ProcessControl::notifyModuleExecute() {
    constexpr const char* fn = "Orvane::ProcessControl::notifyModuleExecute";
    Logger::Put(12, kFile, fn, __LINE__, "notifyModuleExecute enter.");
    SetProcessStatus(Executing, 0);
    Logger::Put(12, kFile, fn, __LINE__, "notifyModuleExecute exit.");
}

VqProcessState ProcessControl::GetModuleStatus() {
    Logger::Put(12, kFile, "Orvane::ProcessControl::GetModuleStatus", __LINE__,
                "GetModuleStatus enter.");
    return GetProcessStatus();
}

void ProcessControl::notifyTransmissionStatus(const std::map<std::string, std::string>& entries) {
    constexpr const char* fn = "Orvane::ProcessControl::notifyTransmissionStatus";
    Logger::Put(13, kFile, fn, __LINE__, "notifyTransmissionStatus enter.");
    TransferStatusNotify message;
    message.statusMap = entries;
    SendTransmissionStatus(getParentStreamName(), message);
    Logger::Put(13, kFile, fn, __LINE__, "notifyTransmissionStatus exit.");
}

}  // namespace Orvane
