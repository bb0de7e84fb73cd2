#include "tests/support/ScriptedTransfer.h"

namespace testsupport {

void ScriptedTransfer::Release() {
    Set(hold_, false);
}

void ScriptedTransfer::Cancel() {
    Set(cancelled_, true);
}

FileTransferResult ScriptedTransfer::Transfer(const FileTransferRequest& request,
                                              FileTransferInfo* info) {
    std::unique_lock<std::mutex> lock(mutex_);
    requests_.push_back(request);
    auto aborted = [this] { return cancelled_ && cancelAborts_; };
    if (aborted()) return TimeOut;
    inTransfer_ = true;
    changed_.notify_all();
    changed_.wait(lock, [&] { return !hold_ || aborted(); });
    inTransfer_ = false;
    if (aborted()) return TimeOut;
    FileTransferResult result = fallback_;
    if (!script_.empty()) {
        result = script_.front();
        script_.pop_front();
    }
    if (info != nullptr) *info = info_;
    return result;
}

}  // namespace testsupport
