// IObjectStore: where a finished object goes (an S3 bucket, a local directory).
//
// The transfer object (one per connection) writes a stream file into one object in memory and
// hands it to its store. Put runs on the caller's (upload) thread and blocks until the object
// is stored or the attempt failed; Cancel may come from any other thread meanwhile and makes
// the running Put, and every later one, return TimeOut within 100 ms.
#pragma once

#include <cstddef>
#include <cstdint>
#include <map>
#include <string>

#include "platform/transfer/FileTransfer.h"

// One object to store. `data` stays valid for the whole Put.
struct ObjectToStore {
    std::string bucket;
    std::string key;                                       // not percent-encoded
    std::string contentType = "application/octet-stream";  // the segment format's
    std::map<std::string, std::string> metadata;           // names without the x-amz-meta- prefix
    const uint8_t* data = nullptr;
    size_t size = 0;
};

// Credentials and routing of one Put, from the transfer request.
struct StoreCredentials {
    std::string accessKey;
    std::string secretKey;
    std::string sessionToken;
    std::string region;
    bool accelerate = false;  // S3 transfer acceleration (AWS endpoint only)
};

class IObjectStore {
  public:
    virtual ~IObjectStore() = default;
    // Stores the object; fills info->fileSize and info->responseTime (ms from the start of
    // the request to the end of the response). Returns one of the FileTransferResult values.
    virtual FileTransferResult Put(const ObjectToStore& object, const StoreCredentials& credentials,
                                   FileTransferInfo* info) = 0;
    virtual void Cancel() = 0;
};
