#include "src/FileRecorderModule.h"

#include "platform/logger/Logger.h"
#include "src/ProcessControl.h"

namespace Orvane {

FileRecorderModule::FileRecorderModule() = default;

FileRecorderModule::~FileRecorderModule() = default;

bool FileRecorderModule::OnInitialize(std::shared_ptr<void>) { return true; }

void FileRecorderModule::OnStop() { Disconnect(); }

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
    processControl_ = processControl;
    settings_ = std::move(settings);
    // The pipeline's components are wired here once they exist.
}

void FileRecorderModule::Disconnect() {}

void FileRecorderModule::WaitForStart() {}

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
