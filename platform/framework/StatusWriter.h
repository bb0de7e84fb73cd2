// StatusWriter: writes the messages a module sends to its parent as one JSON object per line.
//
// Thread-safe: one mutex around the writer, so lines from concurrent senders never interleave.
#pragma once

#include <cstdio>
#include <mutex>
#include <string>

#include "platform/framework/VqMessages.h"
#include "platform/framework/VqResult.h"

class StatusWriter {
  public:
    StatusWriter() = default;
    ~StatusWriter();
    // "-" is stdout; a file is appended to, created with mode 0640, and never opened through a
    // symbolic link at its last component. False when the file cannot be opened.
    bool Open(const std::string& path);

    void WriteTokenRequest(const std::string& destination, const GetAWSSecureTokenRequest& m);
    void WriteLastSequenceNumNotify(const std::string& destination, const LastSequenceNumNotify& m);
    void WriteTransmissionStatus(const std::string& destination, const TransferStatusNotify& m);
    void WriteProcessStatus(const std::string& destination, VqProcessState state,
                            unsigned int code);

  private:
    void writeLine(const std::string& line);

    std::mutex mutex_;
    FILE* file_ = nullptr;  // null: nothing is written
    bool ownsFile_ = false;
};
