// ScriptedTransfer: an IFileTransfer that answers with the results a test asks for and
// records every request it was given.
//
// Results are taken from the script in order; when the script is empty, `fallback` is
// returned. A transfer can be held (Hold) until Release or Cancel; Cancel makes the held
// transfer and every later one return TimeOut, as the real stores do. Thread-safe: every
// member is guarded by mutex_; Transfer blocks only while held.
#pragma once

#include <condition_variable>
#include <deque>
#include <functional>
#include <mutex>
#include <vector>

#include "platform/transfer/FileTransfer.h"
#include "tests/support/Guarded.h"

namespace testsupport {

class ScriptedTransfer : public IFileTransfer, private Guarded {
  public:
    explicit ScriptedTransfer(FileTransferResult fallback = Success) : fallback_(fallback) {}

    void Script(std::vector<FileTransferResult> results) {
        Set(script_, std::deque<FileTransferResult>(results.begin(), results.end()));
    }
    void SetFallback(FileTransferResult result) { Set(fallback_, result); }
    // What every transfer reports in its info.
    void SetInfo(FileTransferInfo info) { Set(info_, info); }
    // The next transfers block until Release or Cancel.
    void Hold() { Set(hold_, true); }
    void Release();
    // When false, Cancel is only recorded and a held transfer waits for Release (a transfer
    // that completes although a stop came meanwhile). Default true.
    void SetCancelAborts(bool aborts) { Set(cancelAborts_, aborts); }

    FileTransferResult Transfer(const FileTransferRequest& request,
                                FileTransferInfo* info) override;
    void Cancel() override;

    std::vector<FileTransferRequest> Requests() const { return Get(requests_); }
    size_t RequestCount() const { return Requests().size(); }
    bool Cancelled() const { return Get(cancelled_); }
    bool InTransfer() const { return Get(inTransfer_); }  // a transfer is blocked in Hold now

  private:
    // Sets a member and wakes a held transfer to look at it again.
    template <typename T>
    void Set(T& member, T value) {
        Guarded::Set(member, std::move(value));
        changed_.notify_all();
    }

    std::condition_variable changed_;
    std::deque<FileTransferResult> script_;
    FileTransferResult fallback_;
    FileTransferInfo info_{};
    bool hold_ = false;
    bool inTransfer_ = false;
    bool cancelled_ = false;
    bool cancelAborts_ = true;
    std::vector<FileTransferRequest> requests_;
};

}  // namespace testsupport
