#include "src/DataUploader.h"

#include "platform/logger/Logger.h"

namespace Orvane {
namespace {
constexpr const char* kFile = "src/DataUploader";
constexpr const char* kUpload = "Orvane::DataUploader::Upload";
}  // namespace

DataUploader::DataUploader(std::shared_ptr<IFileTransfer> transfer)
    : transfer_(std::move(transfer)) {}

FileTransferResult DataUploader::Upload(const FileTransferRequest& request,
                                        FileTransferInfo* info) {
    Logger::Put(13, kFile, kUpload, __LINE__, "Upload enter.");
    if (!transfer_) {
        Logger::Put(4, kFile, kUpload, __LINE__, "create interface failed");
        return OtherError;
    }
    FileTransferResult result = transfer_->Transfer(request, info);
    Logger::Put(13, kFile, kUpload, __LINE__, "Upload exit. %x", static_cast<unsigned>(result));
    return result;
}

void DataUploader::Cancel() {
    if (transfer_) transfer_->Cancel();
}

}  // namespace Orvane
