// S3Response: what an S3 PUT answered, and the transfer result that answer means.
//
// Pure functions over the status, headers and body that S3Store collected; safe from any
// thread. The body of an error answer is S3's XML error document, whose Code decides the
// result more precisely than the HTTP status does.
#pragma once

#include <chrono>
#include <string>

#include "platform/transfer/FileTransfer.h"

struct S3Response {
    long status = 0;         // HTTP status of the final answer (not of a 100 Continue)
    std::string body;        // the first bytes of the body (error documents are small)
    std::string etag;        // ETag header, as sent (quoted)
    std::string date;        // Date header, as sent
    std::string encryption;  // x-amz-server-side-encryption header, "" when absent
    std::string requestId;   // x-amz-request-id header, for logs

    // The text of the first <name>...</name> element of the body, "" when there is none.
    std::string XmlElement(const std::string& name) const;
};

// The result of an answer whose transfer completed: by the XML error Code when there is one,
// else by the status. 2xx is Success (the caller still checks the ETag).
FileTransferResult ClassifyS3Answer(long status, const std::string& code);

// Whether an answer that is not a success may pass by itself, so that the same request can be
// sent again: a 5xx or 429 status, or a throttling or timeout Code (SlowDown, RequestTimeout,
// InternalError, ServiceUnavailable, Throttling ...).
bool RetryableS3Answer(long status, const std::string& code);

// True when `etag` (quoted or not, any case) is the hex MD5 `md5Hex`.
bool EtagMatches(const std::string& etag, const std::string& md5Hex);

// Parses an HTTP date ("Sun, 06 Nov 1994 08:49:37 GMT") or an ISO 8601 UTC time
// ("1994-11-06T08:49:37Z", as in an error document's ServerTime). False when neither.
bool ParseServerTime(const std::string& text, std::chrono::system_clock::time_point& out);
