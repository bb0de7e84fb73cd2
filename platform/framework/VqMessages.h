// Message records exchanged with the module host.
#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <vector>

// Polymorphic base of every message; the recorder never sets `base`.
struct VqMessageBase {
    virtual ~VqMessageBase() = default;
    std::string base;
};

// The host's answer to the module's connection request.
struct ConnectResponse : VqMessageBase {
    std::string source;
};

// The host ends the module's input/output connection.
struct DisconnectInputRequest : VqMessageBase {
    std::string source;
};

// Free-form status map sent to the host ("UploadInfo" -> text).
struct TransferStatusNotify : VqMessageBase {
    std::string text;  // not set by the recorder
    std::map<std::string, std::string> statusMap;
};

// Request for temporary AWS credentials; the recorder sets only streamingId.
struct GetAWSSecureTokenRequest : VqMessageBase {
    std::string requestId;
    std::string streamingId;
    std::string roleName;
    std::string sessionName;
};

// One stream file's outcome.
struct SequenceEntry {
    std::string streamingId;
    uint32_t sequenceNumber = 0;
    bool succeeded = false;
    std::string errorName;
    bool flag = false;
    uint32_t duration = 0;  // milliseconds of stream in the file
};

struct LastSequenceNumNotify : VqMessageBase {
    std::vector<SequenceEntry> entries;
};
