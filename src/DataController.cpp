#include "src/DataController.h"

#include <algorithm>
#include <boost/chrono.hpp>

#include "platform/logger/Logger.h"

namespace Orvane {
namespace {
constexpr const char* kFile = "src/DataController";
// Lines of the upload loop carry this name, whichever of its steps writes them.
constexpr const char* kFileUpload = "Orvane::DataController::fileUpload";

boost::chrono::steady_clock::time_point deadlineAfterMs(int64_t ms) {
    return boost::chrono::steady_clock::now() + boost::chrono::milliseconds(ms);
}
}  // namespace

DataController::DataController(INotifyObserver* observer, std::shared_ptr<IFileBuffer> fileBuffer,
                               std::shared_ptr<ITimeManager> timeManager,
                               std::shared_ptr<IDataUploader> uploader, ModuleSettings settings)
    : observer_(observer),
      fileBuffer_(std::move(fileBuffer)),
      timeManager_(std::move(timeManager)),
      uploader_(std::move(uploader)),
      settings_(std::move(settings)) {
    resultNames_ = {
        {static_cast<int32_t>(Success), "Success"},
        {static_cast<int32_t>(TimeOut), "TimeOut"},
        {static_cast<int32_t>(AuthenticationError), "AuthenticationError"},
        {static_cast<int32_t>(FilePathError), "FilePathError"},
        {static_cast<int32_t>(FileBroken), "FileBroken"},
        {static_cast<int32_t>(NetworkError), "NetworkError"},
        {static_cast<int32_t>(RequestTimeTooSkewed), "RequestTimeTooSkewed"},
        {static_cast<int32_t>(InternalError), "InternalError"},
        {static_cast<int32_t>(OtherError), "OtherError"},
    };
    warningCodes_ = {
        {"TimeOut", 22},       {"AuthenticationError", 23}, {"FilePathError", 24},
        {"FileBroken", 25},    {"NetworkError", 26},        {"RequestTimeTooSkewed", 27},
        {"InternalError", 28},
    };
}

// A lock or join that fails here is a broken invariant with nothing sound left to do: the
// terminate (and its crash report) that an exception leaving a destructor causes is intended.
// NOLINTNEXTLINE(bugprone-exception-escape)
DataController::~DataController() {
    if (uploadThread_.joinable() && uploadThread_.get_id() != std::this_thread::get_id()) Stop();
}

void DataController::Start() {
    constexpr const char* fn = "Orvane::DataController::Start";
    Logger::Put(11, kFile, fn, __LINE__, "Start enter.");
    {
        boost::lock_guard<boost::mutex> lock(mutex_);
        stop_ = false;
    }
    uploadThread_ = std::thread(&DataController::fileUpload, this);
    Logger::Put(11, kFile, fn, __LINE__, "Start exit.");
}

void DataController::Stop() {
    constexpr const char* fn = "Orvane::DataController::Stop";
    Logger::Put(11, kFile, fn, __LINE__, "Stop enter.");
    {
        boost::lock_guard<boost::mutex> lock(mutex_);
        stop_ = true;
    }
    progress_.notify_all();
    {
        std::lock_guard<std::mutex> stopLock(stopMutex_);
        if (uploadThread_.joinable()) {
            uploader_->Cancel();
            fileDurationCondition_.notify_one();
            credentialsCondition_.notify_one();
            fileBuffer_->Push(VqStreamFileData());  // wakes a Pop that waits for a file
            uploadThread_.join();
        }
    }
    Logger::Put(11, kFile, fn, __LINE__, "Stop exit.");
}

void DataController::SetAwsInfo(AwsInfo info) {
    constexpr const char* fn = "Orvane::DataController::SetAwsInfo";
    Logger::Put(12, kFile, fn, __LINE__, "SetAwsInfo enter.");
    {
        boost::lock_guard<boost::mutex> lock(mutex_);
        credentials_ = std::move(info);
        credentialsReceived_ = true;
    }
    credentialsCondition_.notify_one();
    Logger::Put(12, kFile, fn, __LINE__, "SetAwsInfo exit.");
}

bool DataController::stopped() {
    boost::lock_guard<boost::mutex> lock(mutex_);
    return stop_;
}

std::string DataController::resultName(FileTransferResult result) const {
    auto it = resultNames_.find(static_cast<int32_t>(result));
    return it == resultNames_.end() ? std::string("Unknown") : it->second;
}

void DataController::fileUpload() {
    Logger::Put(11, kFile, kFileUpload, __LINE__, "fileUpload enter.");
    int32_t sequenceNumber = 1;
    while (!stopped()) {
        FileTransferRequest request = PopStreamFile(sequenceNumber);
        if (stopped()) break;
        setInHandDuration(request.duration);
        const uint32_t duration = request.duration;
        const UploadOutcome outcome = uploadUntilSettled(request);
        reportFile(sequenceNumber, outcome, duration);
        // `request` (and with it the file's samples) is released here.
    }
    {
        boost::lock_guard<boost::mutex> lock(mutex_);
        threadEnded_ = true;
        inHandDuration_ = 0;
    }
    progress_.notify_all();
    Logger::Put(11, kFile, kFileUpload, __LINE__, "fileUpload exit.");
}

void DataController::setInHandDuration(uint32_t duration) {
    boost::lock_guard<boost::mutex> lock(mutex_);
    inHandDuration_ = duration;
}

DataController::UploadOutcome DataController::uploadUntilSettled(FileTransferRequest& request) {
    UploadOutcome outcome;  // zero info: file size 0, response time 0
    bool attempt = !stopped();
    while (attempt) {
        if (uint64_t count = fileBuffer_->GetBufferCount(); count != 0) {
            Logger::Put(11, nullptr, nullptr, 0, "ST: Buffer Count : %llu",
                        static_cast<unsigned long long>(count));
        }
        bool haveCredentials;
        {
            boost::lock_guard<boost::mutex> lock(mutex_);
            haveCredentials = credentialsReceived_;
        }
        outcome.result =
            haveCredentials ? uploader_->Upload(request, &outcome.info) : AuthenticationError;
        storeFailing_.store(outcome.result != Success, std::memory_order_relaxed);
        if (outcome.result == Success) {
            onUploaded();
            outcome.succeeded = true;
            break;
        }
        if (!reactToFailure(outcome.result, request)) break;
        if (fileBuffer_->IsBufferFull()) {
            outcome.errorName = giveUpOnFullBuffer(outcome.result);
            break;
        }
        attempt = !stopped();
    }
    return outcome;
}

void DataController::onUploaded() {
    Logger::Put(13, kFile, kFileUpload, __LINE__, "FileTransferResult Success.");
    consecutiveAuthErrors_ = 0;
    if (observer_ != nullptr && observer_->GetModuleStatus() == Warning) {
        observer_->notifyModuleExecute();
    }
}

bool DataController::reactToFailure(FileTransferResult result, FileTransferRequest& request) {
    if (result == UploaderDisabled) {
        Logger::Put(11, nullptr, nullptr, 0, "ST: File Uploader is Disabled.");
        return false;
    }
    if (result == OtherError) {
        Logger::Put(4, kFile, kFileUpload, __LINE__, "Other Error.");
        if (observer_ != nullptr) observer_->notifyModuleError(21);
        boost::lock_guard<boost::mutex> lock(mutex_);
        stop_ = true;
        return false;
    }
    if (result == AuthenticationError) {
        Logger::Put(11, nullptr, nullptr, 0, "ST: Authentication Error.");
        renewCredentials(request);
    } else if (result == NetworkError) {
        Logger::Put(11, nullptr, nullptr, 0, "ST: Network Error.");
        waitForFileDuration();
    }
    // Every other result is retried at once.
    return true;
}

void DataController::renewCredentials(FileTransferRequest& request) {
    {
        boost::lock_guard<boost::mutex> lock(mutex_);
        credentialsReceived_ = false;
    }
    ++consecutiveAuthErrors_;
    GetAWSSecureTokenRequest tokenRequest;
    if (observer_ != nullptr) observer_->notifyGetAWSTokenRequest(tokenRequest);
    if (waitAuthenticationInfo()) {
        boost::lock_guard<boost::mutex> lock(mutex_);
        request.accessKey = credentials_.accessKey;
        request.secretKey = credentials_.secretKey;
        request.sessionToken = credentials_.sessionToken;
        request.region = credentials_.region;
    }
}

std::string DataController::giveUpOnFullBuffer(FileTransferResult result) {
    std::string errorName = resultName(result);
    // A single authentication error is routine (expired credentials): no warning for it.
    if (!(errorName == "AuthenticationError" && consecutiveAuthErrors_ < 2) &&
        observer_ != nullptr) {
        auto code = warningCodes_.find(errorName);
        observer_->notifyModuleWarn(
            code == warningCodes_.end() ? 0u : static_cast<unsigned>(code->second));
    }
    return errorName;
}

void DataController::reportFile(int32_t& sequenceNumber, const UploadOutcome& outcome,
                                uint32_t duration) {
    // A file whose upload a stop interrupted is not reported; one that made it is.
    const bool stopNow = stopped();
    if (stopNow && !outcome.succeeded) return;
    notifySequence(sequenceNumber, outcome.succeeded, outcome.errorName, duration);
    notifyUploadInfo(sequenceNumber, outcome.info, outcome.result);
    ++sequenceNumber;
    fileDone(true);
    if (!stopNow) deleteOverFileBuffer(sequenceNumber);
}

void DataController::fileDone(bool wasInHand) {
    {
        boost::lock_guard<boost::mutex> lock(mutex_);
        ++filesDone_;
        if (wasInHand) inHandDuration_ = 0;
    }
    progress_.notify_all();
}

bool DataController::WaitForFiles(uint64_t files, std::chrono::steady_clock::time_point deadline) {
    // The caller's deadline is on std::chrono's steady clock; the wait is on Boost's.
    auto left = std::chrono::duration_cast<std::chrono::milliseconds>(
        deadline - std::chrono::steady_clock::now());
    auto boostDeadline = boost::chrono::steady_clock::now() +
                         boost::chrono::milliseconds(std::max<int64_t>(0, left.count()));
    boost::unique_lock<boost::mutex> lock(mutex_);
    progress_.wait_until(lock, boostDeadline,
                         [&] { return filesDone_ >= files || threadEnded_ || stop_; });
    return filesDone_ >= files;
}

uint64_t DataController::FilesDone() {
    boost::lock_guard<boost::mutex> lock(mutex_);
    return filesDone_;
}

uint64_t DataController::PendingMs() {
    uint64_t inHand;
    {
        boost::lock_guard<boost::mutex> lock(mutex_);
        inHand = inHandDuration_;
    }
    return fileBuffer_->GetBufferCount() + inHand;
}

FileTransferRequest DataController::PopStreamFile(int32_t sequenceNumber) {
    VqStreamFileData record = fileBuffer_->Pop();
    Logger::Put(12, nullptr, nullptr, 0, "ST: PopStreamFile.");
    FileTransferRequest request;
    request.streamingId = settings_.streamingId;
    request.sequenceNumber = sequenceNumber;
    request.bucketName = settings_.bucketName;
    {
        boost::lock_guard<boost::mutex> lock(mutex_);
        request.accessKey = credentials_.accessKey;
        request.secretKey = credentials_.secretKey;
        request.sessionToken = credentials_.sessionToken;
        request.region = credentials_.region;
    }
    request.s3Accel = settings_.s3Accel;
    request.duration = record.duration;
    // The record is ours alone: its samples move into the request (payloads stay shared).
    request.video = std::move(record.video);
    request.audio = std::move(record.audio);
    request.meta = std::move(record.meta);
    return request;
}

bool DataController::waitAuthenticationInfo() {
    constexpr const char* fn = "Orvane::DataController::waitAuthenticationInfo";
    Logger::Put(11, kFile, fn, __LINE__, "waitAuthInfo.");
    boost::unique_lock<boost::mutex> lock(mutex_);
    auto deadline = deadlineAfterMs(settings_.authRetryTime);
    credentialsCondition_.wait_until(lock, deadline,
                                     [this] { return stop_ || credentialsReceived_; });
    if (credentialsReceived_) {
        Logger::Put(11, kFile, fn, __LINE__, "Received Authentication Info.");
        return true;
    }
    if (stop_) {
        Logger::Put(11, kFile, fn, __LINE__, "end.");
    } else {
        Logger::Put(5, kFile, fn, __LINE__, "Not Received Authentication Info.");
    }
    return false;
}

void DataController::waitForFileDuration() {
    constexpr const char* fn = "Orvane::DataController::waitForFileDuration";
    Logger::Put(11, kFile, fn, __LINE__, "wait enter.");
    boost::unique_lock<boost::mutex> lock(mutex_);
    auto deadline = deadlineAfterMs(int64_t{settings_.uploadInterval} * 1000);
    fileDurationCondition_.wait_until(lock, deadline, [this] { return stop_; });
    Logger::Put(11, kFile, fn, __LINE__, "wait exit.");
}

void DataController::deleteOverFileBuffer(int32_t& sequenceNumber) {
    constexpr const char* fn = "Orvane::DataController::deleteOverFileBuffer";
    while (fileBuffer_->IsBufferFull()) {
        VqStreamFileData record = fileBuffer_->Pop();
        Logger::Put(11, kFile, fn, __LINE__, "delete buffer : %d. Buffer Count : %llu.",
                    sequenceNumber, static_cast<unsigned long long>(fileBuffer_->GetBufferCount()));
        notifySequence(sequenceNumber, false, "BufferOver", record.duration);
        notifyUploadInfo(sequenceNumber, FileTransferInfo(), OtherError);
        ++sequenceNumber;
        fileDone(false);
    }
}

void DataController::notifySequence(int32_t sequenceNumber, bool succeeded,
                                    const std::string& errorName, uint32_t duration) {
    if (observer_ == nullptr) return;
    LastSequenceNumNotify message;
    SequenceEntry entry;
    entry.streamingId = settings_.streamingId;
    entry.sequenceNumber = static_cast<uint32_t>(sequenceNumber);
    entry.succeeded = succeeded;
    entry.errorName = errorName;
    entry.flag = false;
    entry.duration = duration;
    message.entries.push_back(std::move(entry));
    observer_->notifyLastSequenceNumNotify(message);
}

void DataController::notifyUploadInfo(int sequenceNumber, const FileTransferInfo& info,
                                      FileTransferResult result) {
    std::string line = "FileIndex, " + std::to_string(sequenceNumber) + ", ErrorCode, " +
                       resultName(result) + ", ResponseTime, " + std::to_string(info.responseTime) +
                       ", FileSize, " + std::to_string(info.fileSize) + ", BufferCount, " +
                       std::to_string(fileBuffer_->GetBufferCount());
    if (observer_ != nullptr) observer_->notifyTransmissionStatus({{"UploadInfo", line}});
}

}  // namespace Orvane
