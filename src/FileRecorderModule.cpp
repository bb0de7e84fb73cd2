#include "src/FileRecorderModule.h"

#include <boost/chrono.hpp>

#include "platform/logger/Logger.h"
#include "src/DataController.h"
#include "src/DataUploader.h"
#include "src/FileBuffer.h"
#include "src/NalAnalyzer.h"
#include "src/ProcessControl.h"
#include "src/StreamBuffer.h"
#include "src/TimeManager.h"

namespace Orvane {
namespace {
constexpr const char* kFile = "src/FileRecorderModule";
}

FileRecorderModule::FileRecorderModule() = default;

FileRecorderModule::~FileRecorderModule() = default;

bool FileRecorderModule::OnInitialize(std::shared_ptr<void>) {
    return true;
}

void FileRecorderModule::OnStop() {
    Disconnect();
}

void FileRecorderModule::OnStart() {}

std::shared_ptr<IStreamBuffer> FileRecorderModule::streamBuffer() const {
    std::lock_guard<std::mutex> lock(componentsMutex_);
    return streamBuffer_;
}

bool FileRecorderModule::IsWaitingForStart() {
    bool notify = false;
    {
        boost::lock_guard<boost::mutex> lock(mutex_);
        if (filing_) return false;
        if (!dataReceived_) {
            dataReceived_ = true;
            notify = true;
        }
    }
    if (notify) condition_.notify_all();
    return true;
}

void FileRecorderModule::ProcessVideo(std::shared_ptr<StreamData> sample) {
    auto buffer = streamBuffer();
    if (!buffer) return;
    if (!IsWaitingForStart()) buffer->ReceiveVideo(std::move(sample));
}

void FileRecorderModule::ProcessAudio(std::shared_ptr<StreamData> sample) {
    auto buffer = streamBuffer();
    if (!buffer) return;
    if (!IsWaitingForStart()) buffer->ReceiveAudio(std::move(sample));
}

void FileRecorderModule::ProcessMeta(std::shared_ptr<StreamData> sample) {
    auto buffer = streamBuffer();
    if (!buffer) return;
    if (IsWaitingForStart()) {
        buffer->ReceiveMetaBeforeStart(std::move(sample));
    } else {
        buffer->ReceiveMeta(std::move(sample));
    }
}

void FileRecorderModule::Connect(ProcessControl* processControl, ModuleSettings settings) {
    if (connected_) {
        // One reply per connection: a repeated one must never replace running components.
        Logger::Put(4, kFile, "Orvane::FileRecorderModule::Connect", __LINE__,
                    "connection reply while connected: ignored.");
        return;
    }
    processControl_ = processControl;
    settings_ = std::move(settings);
    INotifyObserver* observer = processControl_;  // null stays null

    auto timeManager = std::make_shared<TimeManager>();
    // Multiplied as signed 32-bit integers, as the limit always was (wraps, never widens).
    int32_t fullSize =
        static_cast<int32_t>(static_cast<uint32_t>(settings_.bufferFullSize) *
                             static_cast<uint32_t>(settings_.uploadInterval) * 1000u);
    auto fileBuffer = std::make_shared<FileBuffer>(fullSize);
    fileBuffer->SetPopHook([this] { backlogShrank(); });
    auto transfer = transferFactory_ ? transferFactory_() : VqStreamFileTransfer::CreateInterface();
    auto dataUploader = std::make_shared<DataUploader>(std::move(transfer));
    int codecType = static_cast<int>(settings_.codecType);
    auto nalAnalyzer = std::make_shared<NalAnalyzer>(codecType);
    auto streamBuffer =
        std::make_shared<StreamBuffer>(observer, fileBuffer, timeManager, nalAnalyzer, settings_);
    streamBuffer->SetTickHook([this] { backlogShrank(); });
    auto dataController = std::make_shared<DataController>(observer, fileBuffer, timeManager,
                                                           dataUploader, settings_);
    std::optional<AwsInfo> pending;
    {
        std::lock_guard<std::mutex> lock(componentsMutex_);
        timeManager_ = timeManager;
        fileBuffer_ = fileBuffer;
        dataUploader_ = dataUploader;
        nalAnalyzer_ = nalAnalyzer;
        streamBuffer_ = streamBuffer;
        dataController_ = dataController;
        intervalMs_ = static_cast<uint64_t>(std::max(settings_.uploadInterval, 1)) * 1000;
        pending.swap(pendingAwsInfo_);
    }
    if (pending) dataController->SetAwsInfo(*pending);

    {
        boost::lock_guard<boost::mutex> lock(mutex_);
        dataReceived_ = false;
        stopRequested_ = false;
    }
    startThread_ = std::make_shared<std::thread>(&FileRecorderModule::WaitForStart, this);
    connected_ = true;
    streamBuffer->Start();
    dataController->Start();
}

void FileRecorderModule::Disconnect() {
    {
        boost::lock_guard<boost::mutex> lock(mutex_);
        if (stopRequested_) return;
        stopRequested_ = true;
    }
    condition_.notify_all();
    if (startThread_ && startThread_->joinable()) startThread_->join();
    std::shared_ptr<IStreamBuffer> buffer;
    std::shared_ptr<IDataController> controller;
    {
        std::lock_guard<std::mutex> lock(componentsMutex_);
        buffer = streamBuffer_;
        controller = dataController_;
    }
    if (buffer) buffer->Stop();
    if (controller) controller->Stop();
    connected_ = false;
}

void FileRecorderModule::WaitForStart() {
    Logger::Put(11, nullptr, nullptr, 0, "ST: wait for data receive");
    boost::unique_lock<boost::mutex> lock(mutex_);
    condition_.wait(lock, [this] { return stopRequested_ || dataReceived_; });
    if (!stopRequested_) {
        Logger::Put(11, nullptr, nullptr, 0, "ST: data receive event detected");
        dataReceived_ = false;
        auto deadline = boost::chrono::steady_clock::now() +
                        boost::chrono::milliseconds(settings_.startIgnoreTime);
        condition_.wait_until(lock, deadline, [this] { return stopRequested_; });
        if (!stopRequested_) {
            Logger::Put(11, nullptr, nullptr, 0, "ST: start filing");
            filing_ = true;
            return;
        }
    }
    Logger::Put(11, nullptr, nullptr, 0, "ST: stop event detected");
}

FileRecorderModule::DrainResult FileRecorderModule::Drain(
    std::chrono::steady_clock::time_point deadline) {
    DrainResult result;
    std::shared_ptr<IStreamBuffer> buffer;
    std::shared_ptr<IDataController> controller;
    std::shared_ptr<IFileBuffer> fileBuffer;
    {
        std::lock_guard<std::mutex> lock(componentsMutex_);
        buffer = streamBuffer_;
        controller = dataController_;
        fileBuffer = fileBuffer_;
    }
    if (!buffer || !controller) return result;
    FlushQueues();
    buffer->CutRemaining();
    const uint64_t files = fileBuffer->FilesPushed();
    result.complete = controller->WaitForFiles(files, deadline);
    if (!result.complete) {
        uint64_t done = controller->FilesDone();
        result.droppedFiles = files > done ? files - done : 0;
        result.droppedMs = controller->PendingMs();
    }
    return result;
}

bool FileRecorderModule::WaitForBacklog(std::chrono::steady_clock::time_point deadline) {
    std::shared_ptr<IStreamBuffer> buffer;
    std::shared_ptr<IFileBuffer> fileBuffer;
    std::shared_ptr<IDataController> controller;
    uint64_t intervalMs;
    {
        std::lock_guard<std::mutex> lock(componentsMutex_);
        buffer = streamBuffer_;
        fileBuffer = fileBuffer_;
        controller = dataController_;
        intervalMs = intervalMs_;
    }
    if (!buffer || !fileBuffer || !controller) return true;
    // Filing gives everything held up at ten intervals of span (StreamFiling.cpp); the upload
    // loop gives files up while the file buffer holds its limit when a transfer ends. What is
    // held and not yet stored (span + buffer + the file in transfer) is kept below the limit
    // plus half an interval: when the file in transfer is done the buffer is below its limit.
    const uint64_t spanLimitMs = intervalMs * 10 / 2;
    const uint64_t fileLimitMs = fileBuffer->LimitMs();
    const uint64_t pendingLimitMs = fileLimitMs + intervalMs / 2;
    const auto now = std::chrono::steady_clock::now();
    // With no file waiting or in transfer, only filing can shrink the backlog; a span it cannot
    // cut (no IDR) is waited for at most kMaxFilingWait: the stream buffer's own overflow
    // handling then applies, rather than reading stalling. A store that lags is waited for.
    const bool filingWaitOver = filingWaitSince_ && now - *filingWaitSince_ > kMaxFilingWait;
    bool filingBlocked = false;
    std::unique_lock<std::mutex> lock(backlogMutex_);
    const bool roomy = backlogCondition_.wait_until(lock, deadline, [&] {
        const uint64_t span = buffer->HeldSpanMs();
        const uint64_t pending = controller->PendingMs();
        // A store that fails gets no such wait: its files are given up as they would be for
        // a live input, rather than the input stalling until the store works again.
        const bool blocked = span >= spanLimitMs ||
                             (span + pending >= pendingLimitMs && !controller->StoreFailing());
        filingBlocked = blocked && pending == 0;
        return !blocked || (filingBlocked && filingWaitOver);
    });
    if (!filingBlocked) {
        filingWaitSince_.reset();
    } else if (!filingWaitSince_) {
        filingWaitSince_ = now;
    }
    return roomy;
}

void FileRecorderModule::backlogShrank() {
    { std::lock_guard<std::mutex> lock(backlogMutex_); }
    backlogCondition_.notify_all();
}

void FileRecorderModule::FileBufferLevel(uint64_t* levelMs, uint64_t* limitMs) const {
    std::shared_ptr<IFileBuffer> fileBuffer;
    {
        std::lock_guard<std::mutex> lock(componentsMutex_);
        fileBuffer = fileBuffer_;
    }
    *levelMs = fileBuffer ? fileBuffer->GetBufferCount() : 0;
    *limitMs = fileBuffer ? fileBuffer->LimitMs() : 0;
}

void FileRecorderModule::SetTransferFactory(
    std::function<std::shared_ptr<IFileTransfer>()> factory) {
    transferFactory_ = std::move(factory);
}

void FileRecorderModule::SetAwsInfo(const AwsInfo& info) {
    std::shared_ptr<IDataController> controller;
    {
        std::lock_guard<std::mutex> lock(componentsMutex_);
        controller = dataController_;
        if (!controller) pendingAwsInfo_ = info;
    }
    if (controller) controller->SetAwsInfo(info);
}

void FileRecorderModule::StopStreamBuffer() {
    if (auto buffer = streamBuffer()) buffer->Stop();
}

}  // namespace Orvane
