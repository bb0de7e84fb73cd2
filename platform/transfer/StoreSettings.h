// StoreSettings: whether the store that CreateInterface would make can take a recording's
// settings, checked once at start so that a setting that can never work ends the start with
// one clear line instead of failing every transfer.
//
// Pure functions apart from looking at the file system for a local directory store; safe on
// any thread.
#pragma once

#include <string>

#include "platform/framework/FrameworkOptions.h"

// Longest object key S3 accepts, in bytes.
constexpr size_t kMaxObjectKeyBytes = 1024;

// "file:///dir" or "file://localhost/dir" → "/dir" (percent-decoded, trailing '/' removed).
// False for a relative path, another host, a query or fragment, or a bad escape.
bool ParseFileEndpoint(const std::string& url, std::string* directory);

// True when objects of stream `streamingId` can be stored in bucket `bucketName` through
// `options` (endpoint, region, key prefix); otherwise false with one sentence in `why`: an
// endpoint that cannot be used (scheme, port, relative file path, a directory or bucket
// directory that does not exist), a bucket name AWS cannot address, a region that cannot go
// into a request, or keys longer than kMaxObjectKeyBytes. Texts show the endpoint without
// user information.
bool CheckStoreSettings(const FrameworkOptions& options, const std::string& bucketName,
                        const std::string& streamingId, std::string* why);
