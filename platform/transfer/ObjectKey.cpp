#include "platform/transfer/ObjectKey.h"

#include <time.h>

#include <cstdio>

#include "platform/transfer/HttpText.h"
#include "platform/transfer/UtcTime.h"

namespace {

bool printableNotPercent(unsigned char c) {
    return c >= 0x20 && c < 0x7f && c != '%';
}

}  // namespace

uint64_t FirstCaptureTime(const FileTransferRequest& request) {
    bool found = false;
    uint64_t earliest = 0;
    for (const auto* list : {&request.video, &request.audio, &request.meta}) {
        if (list->empty()) continue;
        uint64_t capture = list->front().attribute1;
        if (!found || capture < earliest) earliest = capture;
        found = true;
    }
    return earliest;
}

std::string ObjectKey(const std::string& keyPrefix, const std::string& streamingId,
                      int64_t sequenceNumber, uint64_t captureMicros,
                      const std::string& extension) {
    return keyPrefix + streamingId + "/" + UtcDatePath(captureMicros) + "/" + streamingId + "_" +
           CompactUtcTime(captureMicros) + "_" + std::to_string(sequenceNumber) + extension;
}

std::map<std::string, std::string> ObjectMetadata(const std::string& streamingId,
                                                  int64_t sequenceNumber, uint32_t durationMs,
                                                  uint64_t captureMicros) {
    return {
        {"streaming-id", httptext::PercentEncode(streamingId, printableNotPercent)},
        {"sequence-number", std::to_string(sequenceNumber)},
        {"duration-ms", std::to_string(durationMs)},
        {"capture-time", IsoUtcTime(captureMicros)},
    };
}
