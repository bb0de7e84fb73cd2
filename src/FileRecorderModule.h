// FileRecorderModule: the recorder's module. Wires the pipeline when the host confirms the
// connection (TimeManager, FileBuffer, DataUploader, NalAnalyzer, StreamBuffer,
// DataController), routes the samples its three workers hand it to the stream buffer, and
// holds video and audio back until filing starts: after the first sample and then the start
// ignore time.
//
// Threads: Connect, Disconnect, OnStart, OnStop on the message thread (never concurrently);
// Process* on the three media workers; WaitForStart on the start thread; SetAwsInfo and
// StopStreamBuffer on the message or upload thread. `mutex_` guards the three gate flags;
// `componentsMutex_` guards the component pointers that other threads read.
#pragma once

#include <boost/thread/condition_variable.hpp>
#include <boost/thread/mutex.hpp>
#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <thread>

#include "modulebase/Module.h"
#include "src/AwsInfo.h"
#include "src/IDataController.h"
#include "src/IDataUploader.h"
#include "src/IFileBuffer.h"
#include "src/INalAnalyzer.h"
#include "src/IStreamBuffer.h"
#include "src/ITimeManager.h"
#include "src/ModuleSettings.h"

namespace Orvane {

class ProcessControl;

class FileRecorderModule : public Module {
  public:
    FileRecorderModule();
    ~FileRecorderModule() override;

    bool OnInitialize(std::shared_ptr<void> parameter) override;
    void OnStop() override;
    void OnStart() override;
    void ProcessVideo(std::shared_ptr<StreamData> sample) override;
    void ProcessAudio(std::shared_ptr<StreamData> sample) override;
    void ProcessMeta(std::shared_ptr<StreamData> sample) override;

    // Creates and starts the pipeline. A reply while connected is refused with a log line:
    // running components are never replaced.
    void Connect(ProcessControl* processControl, ModuleSettings settings);
    // Ends the start thread, then stops the stream buffer and the data controller. A second
    // call does nothing.
    void Disconnect();

    // What an end-of-stream drain left undone.
    struct DrainResult {
        bool complete = true;       // everything held was stored (or given up) in time
        uint64_t droppedFiles = 0;  // stream files still in the buffer or in hand
        uint64_t droppedMs = 0;     // their ms of stream
    };
    // End of stream (message thread): waits until the workers have handed on every queued
    // sample, has the stream buffer cut everything it holds into stream files, then waits until
    // the upload loop has done all of them, until `deadline` at the latest. Without a connected
    // pipeline there is nothing to do. Disconnect may come meanwhile from another thread; the
    // drain then ends at once, incomplete.
    DrainResult Drain(std::chrono::steady_clock::time_point deadline);

    // Flow control for an input that can wait (receive thread, after the queues had room):
    // blocks while the recorder holds more stream than it can keep without giving any up:
    // half the span at which filing drops everything held ("input buffer overflow"), or so
    // much unstored stream that the file buffer would reach its limit (files given up as
    // BufferOver) while the store works; a failing store holds nothing back. Woken by the
    // filing thread's ticks and the upload thread's pops. True when below both; false at
    // `deadline`. Without a connected pipeline there is nothing to wait for.
    bool WaitForBacklog(std::chrono::steady_clock::time_point deadline);

    // The file buffer's level and limit in ms, for monitoring; both 0 before Connect. Any thread.
    void FileBufferLevel(uint64_t* levelMs, uint64_t* limitMs) const;

    // Hands credentials to the data controller; before Connect they are kept and handed over
    // when the controller is created.
    void SetAwsInfo(const AwsInfo& info);
    // Stops the stream buffer (module error path); no-op before Connect.
    void StopStreamBuffer();

    // Where Connect gets its transfer interface; VqStreamFileTransfer::CreateInterface unless
    // a test installs another. Call before Connect.
    void SetTransferFactory(std::function<std::shared_ptr<IFileTransfer>()> factory);

  private:
    bool IsWaitingForStart();
    void WaitForStart();
    std::shared_ptr<IStreamBuffer> streamBuffer() const;

    ProcessControl* processControl_ = nullptr;  // not owned
    std::shared_ptr<IDataController> dataController_;
    std::shared_ptr<IStreamBuffer> streamBuffer_;
    std::shared_ptr<IFileBuffer> fileBuffer_;
    std::shared_ptr<ITimeManager> timeManager_;
    std::shared_ptr<IDataUploader> dataUploader_;
    std::shared_ptr<INalAnalyzer> nalAnalyzer_;
    bool filing_ = false;                  // the start thread opened the gate
    bool dataReceived_ = false;            // event: a sample found the gate closed
    bool stopRequested_ = false;           // set by Disconnect
    boost::mutex mutex_;                   // guards the three flags above
    boost::condition_variable condition_;  // the start thread waits on it
    std::shared_ptr<std::thread> startThread_;
    ModuleSettings settings_;

    mutable std::mutex componentsMutex_;     // guards the component pointers and pendingAwsInfo_
    std::optional<AwsInfo> pendingAwsInfo_;  // credentials that came before Connect
    bool connected_ = false;                 // between Connect and Disconnect (message thread)
    uint64_t intervalMs_ = 0;                // the upload interval, ms; componentsMutex_
    std::function<std::shared_ptr<IFileTransfer>()> transferFactory_;

    // The held stream may have shrunk (filing and upload threads).
    void backlogShrank();
    std::mutex backlogMutex_;  // WaitForBacklog's wait; orders its check against the wake-ups
    std::condition_variable backlogCondition_;
    static constexpr std::chrono::seconds kMaxFilingWait{10};
    // Since when WaitForBacklog has found a backlog that only filing could shrink; receive
    // thread only.
    std::optional<std::chrono::steady_clock::time_point> filingWaitSince_;
};

}  // namespace Orvane
