// DataUploader: the upload thread's only door to the file transfer library. Adds a log line
// before and after each transfer and turns a missing transfer interface into OtherError.
//
// Upload runs on the upload thread; Cancel on the thread that stops the controller, possibly
// while Upload is inside Transfer (IFileTransfer accepts that). No lock of its own.
#pragma once

#include <memory>

#include "src/IDataUploader.h"

namespace Orvane {

class DataUploader : public IDataUploader {
  public:
    // `transfer` may be empty (CreateInterface failed): every Upload then gives OtherError.
    explicit DataUploader(std::shared_ptr<IFileTransfer> transfer);
    FileTransferResult Upload(const FileTransferRequest& request, FileTransferInfo* info) override;
    void Cancel() override;

  private:
    const std::shared_ptr<IFileTransfer> transfer_;
};

}  // namespace Orvane
