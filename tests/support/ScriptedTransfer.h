// ScriptedTransfer: an IFileTransfer that answers with the results a test asks for and
// records every request it was given.
//
// Results are taken from the script in order; when the script is empty, `fallback` is
// returned. A transfer can be held (Hold) until Release or Cancel; Cancel makes the held
// transfer and every later one return TimeOut, as the real stores do. Thread-safe.
#pragma once

#include <condition_variable>
#include <deque>
#include <functional>
#include <mutex>
#include <vector>

#include "platform/transfer/FileTransfer.h"

namespace testsupport {

class ScriptedTransfer : public IFileTransfer {
  public:
    explicit ScriptedTransfer(FileTransferResult fallback = Success) : fallback_(fallback) {}

    void Script(std::vector<FileTransferResult> results);
    void SetFallback(FileTransferResult result);
    // What every transfer reports in its info.
    void SetInfo(FileTransferInfo info);
    // The next transfers block until Release or Cancel.
    void Hold();
    void Release();
    // When false, Cancel is only recorded and a held transfer waits for Release (a transfer
    // that completes although a stop came meanwhile). Default true.
    void SetCancelAborts(bool aborts);

    FileTransferResult Transfer(const FileTransferRequest& request,
                                FileTransferInfo* info) override;
    void Cancel() override;

    std::vector<FileTransferRequest> Requests() const;
    size_t RequestCount() const;
    bool Cancelled() const;
    bool InTransfer() const;  // a transfer is blocked in Hold now

  private:
    mutable std::mutex mutex_;
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
