// The file transfer library's contract: one stream file in, one stored object out.
//
// IFileTransfer::Transfer runs on the recorder's upload thread and blocks until the object is
// stored or the attempt failed; Cancel may come from any other thread meanwhile and makes the
// running Transfer (and every later one) return TimeOut soon.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/framework/StreamData.h"

// Result of one transfer: 0 for success, the top bit set for errors.
enum FileTransferResult : uint32_t {
    Success = 0x00000000,
    UploaderDisabled = 0x00000001,
    TimeOut = 0x80000010,
    AuthenticationError = 0x80000011,
    FilePathError = 0x80000012,
    FileBroken = 0x80000013,
    NetworkError = 0x80000014,
    RequestTimeTooSkewed = 0x80000015,
    InternalError = 0x80000016,
    OtherError = 0x80000020,
};

// One stream file to store, with where and with which credentials.
struct FileTransferRequest {
    std::string streamingId;
    int64_t sequenceNumber = 0;  // 1, 2, 3 ... within one run of the upload thread
    std::string bucketName;
    std::string accessKey;
    std::string secretKey;
    std::string region;
    std::string sessionToken;
    bool s3Accel = false;           // use S3 transfer acceleration
    uint32_t duration = 0;          // milliseconds of stream in the file
    std::vector<StreamData> video;  // oldest first
    std::vector<StreamData> audio;
    std::vector<StreamData> meta;
};

// What a transfer reports back.
struct FileTransferInfo {
    uint64_t fileSize = 0;      // bytes of the stored object
    uint32_t responseTime = 0;  // ms from the start of the request to the end of the response
};

class IFileTransfer {
  public:
    virtual ~IFileTransfer() = default;
    virtual FileTransferResult Transfer(const FileTransferRequest& request,
                                        FileTransferInfo* info) = 0;
    // Not called by the recorder.
    virtual FileTransferResult Abort() { return Success; }
    virtual void Cancel() = 0;
};

class VqStreamFileTransfer {
  public:
    // A transfer object configured from the framework's options (endpoint, format, key
    // prefix); empty when that configuration cannot work (the reason is logged).
    static std::shared_ptr<IFileTransfer> CreateInterface();
};
