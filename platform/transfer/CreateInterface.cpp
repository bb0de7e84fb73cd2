// VqStreamFileTransfer::CreateInterface: the transfer object for this process's options.
//
// `-endpoint file:///dir` stores into a local directory; any other endpoint (or none: AWS)
// stores into S3, in the segment format of -segmentformat. A configuration that cannot work
// gives an empty pointer and one log line that says why; the endpoint is logged without any user
// information it may carry.
#include <cctype>
#include <string>

#include "platform/framework/FrameworkOptions.h"
#include "platform/logger/Logger.h"
#include "platform/transfer/FileTransfer.h"
#include "platform/transfer/LocalDirectoryStore.h"
#include "platform/transfer/ObjectKey.h"
#include "platform/transfer/S3Store.h"
#include "platform/transfer/SegmentFormat.h"
#include "platform/transfer/SegmentTransfer.h"
#include "platform/transfer/StoreSettings.h"

namespace {

constexpr const char* kFile = "platform/transfer/CreateInterface";
constexpr const char* kFunction = "VqStreamFileTransfer::CreateInterface";

// The URL without "user:password@", for log lines.
std::string withoutUserInfo(const std::string& url) {
    size_t scheme = url.find("://");
    size_t hostStart = scheme == std::string::npos ? 0 : scheme + 3;
    size_t hostEnd = url.find_first_of("/?#", hostStart);
    size_t at = url.rfind('@', hostEnd == std::string::npos ? std::string::npos : hostEnd);
    if (at == std::string::npos || at < hostStart) return url;
    return url.substr(0, hostStart) + "***@" + url.substr(at + 1);
}

bool startsWithNoCase(const std::string& text, const std::string& prefix) {
    if (text.size() < prefix.size()) return false;
    for (size_t i = 0; i < prefix.size(); ++i)
        if (std::tolower(static_cast<unsigned char>(text[i])) != prefix[i]) return false;
    return true;
}

// A file URL: a local directory store, when the keys of this stream can stay inside a bucket
// directory (a key prefix or stream id with "." or ".." parts would lead outside).
std::shared_ptr<IObjectStore> createLocalStore(const FrameworkOptions& options,
                                               const SegmentFormat& format) {
    std::string directory;
    if (!ParseFileEndpoint(options.endpoint, &directory)) {
        Logger::Put(4, kFile, kFunction, __LINE__,
                    "endpoint \"%s\" is not a usable file URL (file:///absolute/directory)",
                    withoutUserInfo(options.endpoint).c_str());
        return nullptr;
    }
    std::string why;
    const std::string key =
        ObjectKey(options.keyPrefix, options.streamingId, 1, 0, format.extension);
    if (!LocalDirectoryStore::ValidKey(key, why)) {
        Logger::Put(4, kFile, kFunction, __LINE__,
                    "a local directory cannot hold the keys of this stream: %s", why.c_str());
        return nullptr;
    }
    return std::make_shared<LocalDirectoryStore>(directory);
}

// Any endpoint that is not a file URL: an S3 store ("" means AWS itself).
std::shared_ptr<IObjectStore> createS3Store(const FrameworkOptions& options) {
    S3StoreConfig config;
    std::string why;
    if (!S3StoreConfig::Parse(options.endpoint, config, why)) {
        Logger::Put(4, kFile, kFunction, __LINE__, "endpoint \"%s\" cannot be used: %s",
                    withoutUserInfo(options.endpoint).c_str(), why.c_str());
        return nullptr;
    }
    const UploadOptions& upload = options.upload;
    config.objectHeaders = upload.Headers();
    config.caBundle = upload.caBundle;
    config.addressing = upload.addressing == "path"      ? S3Addressing::kPath
                        : upload.addressing == "virtual" ? S3Addressing::kVirtual
                                                         : S3Addressing::kAuto;
    return std::make_shared<S3Store>(config);
}

}  // namespace

std::shared_ptr<IFileTransfer> VqStreamFileTransfer::CreateInterface() {
    const FrameworkOptions options = CurrentFrameworkOptions();
    const SegmentFormat* format = SegmentFormat::Find(options.segmentFormat);
    if (!format) {
        Logger::Put(4, kFile, kFunction, __LINE__,
                    "segment format \"%s\" is not supported (only %s)",
                    options.segmentFormat.c_str(), SegmentFormat::Names().c_str());
        return nullptr;
    }
    std::shared_ptr<IObjectStore> store = startsWithNoCase(options.endpoint, "file:")
                                              ? createLocalStore(options, *format)
                                              : createS3Store(options);
    if (!store) return nullptr;
    return std::make_shared<SegmentTransfer>(store, options.keyPrefix, *format);
}
