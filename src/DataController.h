// DataController: owns the upload thread. The thread takes the finished stream files out of
// the file buffer, oldest first, and hands each to the uploader until it is uploaded, given
// up, or the controller stops. Per transfer result it retries at once, waits one upload
// interval (network error), fetches new credentials from the host (authentication error),
// gives the file up while the buffer is over its limit, or ends (OtherError). It drops the
// oldest files while the buffer is over its limit, and reports every file to the host: a
// LastSequenceNumNotify and an "UploadInfo" line, numbered 1, 2, 3 ... without gaps.
//
// Threads: Start, Stop and the destructor on the connecting thread; SetAwsInfo on the
// framework's message thread; everything else on the upload thread. `mutex_` guards the
// credentials, the credentials-received flag and the stop flag; the two timed waits hold it
// while testing and release it while waiting. No lock is held while the uploader, the file
// buffer or the observer is called.
#pragma once

#include <atomic>
#include <boost/thread/condition_variable.hpp>
#include <boost/thread/mutex.hpp>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>

#include "src/AwsInfo.h"
#include "src/IDataController.h"
#include "src/IDataUploader.h"
#include "src/IFileBuffer.h"
#include "src/INotifyObserver.h"
#include "src/ITimeManager.h"
#include "src/ModuleSettings.h"

namespace Orvane {

class DataController : public IDataController {
  public:
    DataController(INotifyObserver* observer, std::shared_ptr<IFileBuffer> fileBuffer,
                   std::shared_ptr<ITimeManager> timeManager,
                   std::shared_ptr<IDataUploader> uploader, ModuleSettings settings);
    // Stops the upload thread if the owner did not (a joinable thread must never be destroyed).
    ~DataController() override;  // NOLINT(bugprone-exception-escape): see the definition

    void Start() override;
    void Stop() override;
    void SetAwsInfo(AwsInfo info) override;
    bool WaitForFiles(uint64_t files, std::chrono::steady_clock::time_point deadline) override;
    uint64_t FilesDone() override;
    uint64_t PendingMs() override;
    bool StoreFailing() override { return storeFailing_.load(std::memory_order_relaxed); }

  private:
    // What became of one file: uploaded, or the last failed result and, when given up because
    // the buffer was over its limit, that result's name.
    struct UploadOutcome {
        bool succeeded = false;
        std::string errorName;
        FileTransferInfo info;
        FileTransferResult result = Success;
    };

    // The upload thread: pop a file, upload it until settled, report it, drop overflow.
    void fileUpload();
    void setInHandDuration(uint32_t duration);
    // Attempts until success, a result that ends the attempts, a full buffer, or Stop.
    UploadOutcome uploadUntilSettled(FileTransferRequest& request);
    void onUploaded();
    // The reaction to a failed result; false when the attempts end (disabled, OtherError).
    bool reactToFailure(FileTransferResult result, FileTransferRequest& request);
    // Asks the host for credentials, waits for them and puts them into `request`.
    void renewCredentials(FileTransferRequest& request);
    // Warns the host (except for a first authentication error); returns the result's name.
    std::string giveUpOnFullBuffer(FileTransferResult result);
    // Reports the file and drops the overflow, unless a stop interrupted an unfinished upload.
    void reportFile(int32_t& sequenceNumber, const UploadOutcome& outcome, uint32_t duration);
    FileTransferRequest PopStreamFile(int32_t sequenceNumber);
    bool waitAuthenticationInfo();
    void waitForFileDuration();
    // Drops the oldest files while the buffer is over its limit; advances `sequenceNumber`.
    void deleteOverFileBuffer(int32_t& sequenceNumber);
    void notifyUploadInfo(int sequenceNumber, const FileTransferInfo& info,
                          FileTransferResult result);
    void notifySequence(int32_t sequenceNumber, bool succeeded, const std::string& errorName,
                        uint32_t duration);
    std::string resultName(FileTransferResult result) const;
    // A file left the buffer for good (`wasInHand`: the one being uploaded, not a dropped one).
    void fileDone(bool wasInHand);
    bool stopped();

    INotifyObserver* const observer_;  // not owned; may be null
    const std::shared_ptr<IFileBuffer> fileBuffer_;
    const std::shared_ptr<ITimeManager> timeManager_;  // held for the controller's lifetime
    const std::shared_ptr<IDataUploader> uploader_;
    bool stop_ = false;  // guarded by mutex_
    std::thread uploadThread_;
    int32_t consecutiveAuthErrors_ = 0;      // upload thread only; reset by a success
    std::atomic<bool> storeFailing_{false};  // the last attempt failed; set by the upload thread
    AwsInfo credentials_;                    // guarded by mutex_
    const ModuleSettings settings_;
    std::map<int32_t, std::string> resultNames_;   // result value -> name
    std::map<std::string, int32_t> warningCodes_;  // result name -> module warning code
    bool credentialsReceived_ = false;             // guarded by mutex_
    boost::condition_variable credentialsCondition_;
    boost::mutex mutex_;
    boost::condition_variable fileDurationCondition_;
    std::mutex stopMutex_;  // serialises Stop's cancel-and-join

    // Progress of the upload thread, for the end-of-stream drain; guarded by mutex_.
    uint64_t filesDone_ = 0;              // files that left the buffer for good and were reported
    uint32_t inHandDuration_ = 0;         // ms of the file being uploaded, 0 when none
    bool threadEnded_ = false;            // fileUpload returned
    boost::condition_variable progress_;  // notified (all) at each of those changes
};

}  // namespace Orvane
