// ObjectKey: where a stream file is stored, and the metadata its object carries.
//
// Key: <keyPrefix><streamingId>/<YYYY>/<MM>/<DD>/<streamingId>_<YYYYMMDDThhmmss.mmmZ>_<seq><ext>
// with the wall-clock capture time (UTC) of the object's first sample. The capture time makes
// the keys of two runs of one stream differ although sequence numbers restart at 1.
//
// Pure functions; safe on any thread.
#pragma once

#include <cstdint>
#include <map>
#include <string>

#include "platform/transfer/FileTransfer.h"
#include "platform/transfer/UtcTime.h"

// Capture time of the request's first sample: the earliest attribute1 (µs since the Unix
// epoch) among the first samples of the three lists; 0 when the request has no samples.
uint64_t FirstCaptureTime(const FileTransferRequest& request);

// `extension` is the segment format's (".ts").
std::string ObjectKey(const std::string& keyPrefix, const std::string& streamingId,
                      int64_t sequenceNumber, uint64_t captureMicros, const std::string& extension);

// The object's metadata (names without a transport prefix): "streaming-id", "sequence-number",
// "duration-ms", "capture-time" (ISO 8601, UTC). Values are printable ASCII: other bytes and
// '%' are percent-encoded, so a stream id can never smuggle a line break into a header.
std::map<std::string, std::string> ObjectMetadata(const std::string& streamingId,
                                                  int64_t sequenceNumber, uint32_t durationMs,
                                                  uint64_t captureMicros);
