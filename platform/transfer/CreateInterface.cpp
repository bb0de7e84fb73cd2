// Until the stores are built, no transfer interface can be made.
#include "platform/logger/Logger.h"
#include "platform/transfer/FileTransfer.h"

std::shared_ptr<IFileTransfer> VqStreamFileTransfer::CreateInterface() {
    Logger::Put(4, "platform/transfer/CreateInterface", "VqStreamFileTransfer::CreateInterface",
                __LINE__, "no object store in this build");
    return nullptr;
}
