// IDataUploader: the upload thread's door to the file transfer library.
#pragma once

#include "platform/transfer/FileTransfer.h"

namespace Orvane {

class IDataUploader {
  public:
    // Upload thread; blocks for the whole transfer.
    virtual FileTransferResult Upload(const FileTransferRequest& request,
                                      FileTransferInfo* info) = 0;
    // Any other thread: makes a running Upload return soon.
    virtual void Cancel() = 0;
    virtual ~IDataUploader() = default;
};

}  // namespace Orvane
