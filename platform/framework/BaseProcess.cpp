#include "platform/framework/BaseProcess.h"

#include <set>
#include <utility>

#include "platform/logger/Logger.h"

namespace {
constexpr const char* kFile = "platform/framework/BaseProcess";
}

BaseProcess::BaseProcess(int argc, char** argv, bool, bool) : commandLine_(argc, argv) {
    options_ = FrameworkOptions::Read(commandLine_, optionErrors_);
    Logger::SetLevel(options_.logLevel);
    if (!options_.logFile.empty() && !Logger::SetFile(options_.logFile)) {
        optionErrors_.push_back("-logfile: cannot open \"" + options_.logFile + "\"");
    }
    SetCurrentFrameworkOptions(options_);
}

BaseProcess::~BaseProcess() = default;

void BaseProcess::SetHost(std::shared_ptr<IModuleHost> host) {
    std::lock_guard<std::mutex> lock(mutex_);
    host_ = std::move(host);
}

std::shared_ptr<IModuleHost> BaseProcess::hostSnapshot() {
    std::lock_guard<std::mutex> lock(mutex_);
    return host_;
}

bool BaseProcess::Initialize() {
    constexpr const char* fn = "BaseProcess::Initialize";
    // The module's option messages come first: they are what a user most often gets wrong.
    const bool moduleReady = initializeProcess(std::string());
    std::set<std::string> known;
    for (const auto& o : FrameworkOptions::Help()) known.insert(o.name);
    for (const auto& o : moduleOptions()) known.insert(o.name);
    const std::vector<std::string> faults = commandLine_.CheckShape(known);
    for (const auto& fault : faults) Logger::Put(4, kFile, fn, __LINE__, "%s", fault.c_str());
    if (!moduleReady || !faults.empty()) return false;
    for (const auto& error : optionErrors_) {
        Logger::Put(4, kFile, fn, __LINE__, "bad option: %s", error.c_str());
    }
    if (!optionErrors_.empty()) return false;
    if (!status_.Open(options_.statusPath)) {
        Logger::Put(4, kFile, "BaseProcess::Initialize", __LINE__,
                    "cannot open the status output \"%s\"", options_.statusPath.c_str());
        return false;
    }
    auto host = hostSnapshot();
    if (!host) {
        if (options_.input.empty()) {
            Logger::Put(4, kFile, "BaseProcess::Initialize", __LINE__,
                        "no input to record: give -input FILE_OR_URL");
            return false;
        }
        host = CreateMediaHost(options_);
        if (!host) return false;
        SetHost(host);
    }
    if (!host->Prepare(*this)) return false;
    SetProcessStatus(Initialized, 0);
    return true;
}

bool BaseProcess::Execute() {
    auto host = hostSnapshot();
    if (!host) return false;
    if (!startProcess()) return false;
    SetProcessStatus(Executing, 0);
    host->Run(*this);
    DisconnectInputRequest request;
    notifyInputOutputDisconnectionRequest(request);
    stopProcess();
    return true;
}

BaseProcess::Outcome BaseProcess::RunOutcome() {
    std::lock_guard<std::mutex> lock(mutex_);
    Outcome outcome;
    if (state_ == Error) {
        outcome.status = kExitModuleError;
        outcome.why = "recorder stopped: module error " + std::to_string(code_);
    } else if (storedFiles_ == 0 && givenUpFiles_ > 0) {
        outcome.status = kExitNothingStored;
        outcome.why = "nothing was stored: all " + std::to_string(givenUpFiles_) +
                      " stream files were given up (last error: " +
                      (lastError_.empty() ? std::string("none named") : lastError_) + ")";
    }
    return outcome;
}

void BaseProcess::Uninitialize() {
    std::lock_guard<std::mutex> lock(mutex_);
    host_.reset();
}

// NOLINTNEXTLINE(performance-unnecessary-value-param): the module API's signature
bool BaseProcess::GetArgument_str(std::string name, std::string& value, std::string defaultValue) {
    if (!name.empty() && name[0] == '-') name.erase(0, 1);
    if (commandLine_.Find(name, value)) return true;
    value = std::move(defaultValue);
    return false;
}

bool BaseProcess::GetArgument_int(std::string name, int& value, int, int) {
    if (!name.empty() && name[0] == '-') name.erase(0, 1);
    std::string text;
    if (!commandLine_.Find(name, text)) return false;
    return CommandLine::ParseInt(text, value);
}

std::string BaseProcess::GetStreamingId() {
    return options_.streamingId;
}

std::string BaseProcess::getParentStreamName() {
    return options_.parent;
}

ProcessReadings BaseProcess::Readings() {
    ProcessReadings readings;
    std::shared_ptr<IModuleHost> host;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        readings.state = state_;
        readings.code = code_;
        readings.files = filesByResult_;
        host = host_;
    }
    if (host) host->AddReadings(readings);
    moduleReadings(readings);
    return readings;
}

void BaseProcess::moduleReadings(ProcessReadings&) {}

void BaseProcess::SetProcessStatus(VqProcessState state, unsigned int code) {
    std::shared_ptr<IModuleHost> host;
    {
        std::lock_guard<std::mutex> lock(mutex_);
        state_ = state;
        code_ = code;
        host = host_;
    }
    status_.WriteProcessStatus(options_.parent, state, code);
    if (host) host->OnProcessStatus(state, code);
}

VqProcessState BaseProcess::GetProcessStatus() {
    std::lock_guard<std::mutex> lock(mutex_);
    return state_;
}

unsigned int BaseProcess::GetProcessStatusCode() {
    std::lock_guard<std::mutex> lock(mutex_);
    return code_;
}

VqResult BaseProcess::SendTransmissionStatus(const std::string& destination,
                                             TransferStatusNotify& message) {
    status_.WriteTransmissionStatus(destination, message);
    if (auto host = hostSnapshot()) host->OnTransmissionStatus(message);
    return VQ_OK;
}

VqResult BaseProcess::SendGetAWSTokenRequest(const std::string& destination,
                                             GetAWSSecureTokenRequest& message) {
    status_.WriteTokenRequest(destination, message);
    if (auto host = hostSnapshot()) host->OnTokenRequest(message);
    return VQ_OK;
}

VqResult BaseProcess::SendLastSequenceNumNotify(const std::string& destination,
                                                LastSequenceNumNotify& message) {
    status_.WriteLastSequenceNumNotify(destination, message);
    {
        std::lock_guard<std::mutex> lock(mutex_);
        for (const auto& entry : message.entries) {
            ++filesByResult_[entry.succeeded           ? std::string("Success")
                             : entry.errorName.empty() ? std::string("Unnamed")
                                                       : entry.errorName];
            if (entry.succeeded) {
                ++storedFiles_;
            } else {
                ++givenUpFiles_;
                // A file dropped because the buffer was over its limit says less than the
                // transfer error that kept the files in the buffer.
                if (lastError_.empty() || entry.errorName != "BufferOver")
                    lastError_ = entry.errorName;
            }
        }
    }
    if (auto host = hostSnapshot()) host->OnLastSequenceNumNotify(message);
    return VQ_OK;
}

VqResult BaseProcess::notifyModuleConnectionRequestReply(ConnectResponse&) {
    return VQ_OK;
}

VqResult BaseProcess::notifyInputOutputDisconnectionRequest(DisconnectInputRequest&) {
    return VQ_OK;
}

VqResult BaseProcess::notifyGetAWSTokenRequest(GetAWSSecureTokenRequest&) {
    return VQ_OK;
}

VqResult BaseProcess::notifyLastSequenceNumNotify(LastSequenceNumNotify&) {
    return VQ_OK;
}

VqResult BaseProcess::notifyTransmissionStatus(TransferStatusNotify&) {
    return VQ_OK;
}

bool BaseProcess::waitForSampleRoom(size_t, size_t, size_t, std::chrono::steady_clock::time_point) {
    return true;
}

// NOLINTNEXTLINE(performance-unnecessary-value-param): the module API's signature
bool BaseProcess::initializeProcess(std::string) {
    return true;
}

void BaseProcess::stopProcess() {}

bool BaseProcess::startProcess() {
    return true;
}

bool BaseProcess::setProperties(std::map<std::string, std::string>&) {
    return true;
}

bool BaseProcess::drainProcess(int64_t) {
    return true;
}

std::vector<OptionHelp> BaseProcess::moduleOptions() const {
    return {};
}

bool BaseProcess::checkInput(const InputInfo&) {
    return true;
}
