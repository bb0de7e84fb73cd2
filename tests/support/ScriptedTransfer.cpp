#include "tests/support/ScriptedTransfer.h"

namespace testsupport {

void ScriptedTransfer::Script(std::vector<FileTransferResult> results) {
    std::lock_guard<std::mutex> lock(mutex_);
    script_.assign(results.begin(), results.end());
}

void ScriptedTransfer::SetFallback(FileTransferResult result) {
    std::lock_guard<std::mutex> lock(mutex_);
    fallback_ = result;
}

void ScriptedTransfer::SetInfo(FileTransferInfo info) {
    std::lock_guard<std::mutex> lock(mutex_);
    info_ = info;
}

void ScriptedTransfer::Hold() {
    std::lock_guard<std::mutex> lock(mutex_);
    hold_ = true;
}

void ScriptedTransfer::SetCancelAborts(bool aborts) {
    std::lock_guard<std::mutex> lock(mutex_);
    cancelAborts_ = aborts;
}

void ScriptedTransfer::Release() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        hold_ = false;
    }
    changed_.notify_all();
}

FileTransferResult ScriptedTransfer::Transfer(const FileTransferRequest& request,
                                              FileTransferInfo* info) {
    std::unique_lock<std::mutex> lock(mutex_);
    requests_.push_back(request);
    if (cancelled_ && cancelAborts_) return TimeOut;
    inTransfer_ = true;
    changed_.notify_all();
    changed_.wait(lock, [this] { return !hold_ || (cancelled_ && cancelAborts_); });
    inTransfer_ = false;
    if (cancelled_ && cancelAborts_) return TimeOut;
    FileTransferResult result = fallback_;
    if (!script_.empty()) {
        result = script_.front();
        script_.pop_front();
    }
    if (info != nullptr) *info = info_;
    return result;
}

void ScriptedTransfer::Cancel() {
    {
        std::lock_guard<std::mutex> lock(mutex_);
        cancelled_ = true;
    }
    changed_.notify_all();
}

std::vector<FileTransferRequest> ScriptedTransfer::Requests() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return requests_;
}

size_t ScriptedTransfer::RequestCount() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return requests_.size();
}

bool ScriptedTransfer::Cancelled() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return cancelled_;
}

bool ScriptedTransfer::InTransfer() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return inTransfer_;
}

}  // namespace testsupport
