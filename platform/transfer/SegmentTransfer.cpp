#include "platform/transfer/SegmentTransfer.h"

#include <algorithm>
#include <atomic>
#include <cinttypes>

#include "platform/logger/Logger.h"
#include "platform/transfer/ObjectKey.h"

namespace {
constexpr const char* kFile = "platform/transfer/SegmentTransfer";
constexpr const char* kFunction = "SegmentTransfer::Transfer";

uint64_t nextRunId() {
    static std::atomic<uint64_t> last{0};
    return ++last;
}

const std::shared_ptr<const TrackDescription>* trackOf(const StreamData& sample) {
    return sample.source ? &sample.source->Track() : nullptr;
}

}  // namespace

SegmentTransfer::SegmentTransfer(std::shared_ptr<IObjectStore> store, std::string keyPrefix,
                                 const SegmentFormat& format, RetryPolicy pacing)
    : store_(std::move(store)),
      keyPrefix_(std::move(keyPrefix)),
      format_(format),
      writer_(format),
      floor_(pacing),
      runId_(nextRunId()) {}

void SegmentTransfer::Cancel() {
    cancel_.Raise();
    if (store_) store_->Cancel();
}

FileTransferResult SegmentTransfer::Transfer(const FileTransferRequest& request,
                                             FileTransferInfo* info) {
    FileTransferInfo localInfo;
    if (!info) info = &localInfo;
    info->fileSize = 0;
    info->responseTime = 0;
    if (cancel_.Raised()) return TimeOut;
    if (!store_) return OtherError;

    if (request.video.empty() && request.audio.empty() && request.meta.empty()) {
        Logger::Put(13, kFile, kFunction, __LINE__,
                    "stream file %" PRId64 " of %s has no samples: no object",
                    request.sequenceNumber, request.streamingId.c_str());
        return Success;
    }
    const auto wait = floor_.Remaining(std::chrono::steady_clock::now());
    if (wait.count() > 0) {
        Logger::Put(13, kFile, kFunction, __LINE__,
                    "stream file %" PRId64 " waits %lld ms after failed transfers",
                    request.sequenceNumber,
                    static_cast<long long>(
                        std::chrono::duration_cast<std::chrono::milliseconds>(wait).count()));
        if (!cancel_.Wait(wait)) return TimeOut;
    }

    StoredObject event;
    event.streamingId = request.streamingId;
    event.sequenceNumber = request.sequenceNumber;
    event.bucket = request.bucketName;
    event.format = &format_;
    event.durationMs = request.duration;
    event.captureMicros = FirstCaptureTime(request);
    event.key = ObjectKey(keyPrefix_, request.streamingId, request.sequenceNumber,
                          event.captureMicros, format_.extension);
    event.runId = runId_;
    if (!request.video.empty()) {
        const auto* first = trackOf(request.video.front());
        event.newInput = lastVideoTrack_ && first && *first != lastVideoTrack_;
    }
    StoreCredentials credentials;
    credentials.accessKey = request.accessKey;
    credentials.secretKey = request.secretKey;
    credentials.sessionToken = request.sessionToken;
    credentials.region = request.region;
    credentials.accelerate = request.s3Accel;
    event.result = writeAndStore(request, event, credentials, info);
    event.initKey = initKey_;
    floor_.Record(event.result == Success, std::chrono::steady_clock::now());
    if (event.result == Success && !request.video.empty())
        if (const auto* last = trackOf(request.video.back())) lastVideoTrack_ = *last;
    event.size = info->fileSize;
    event.responseTimeMs = info->responseTime;
    event.store = store_.get();
    event.credentials = &credentials;
    ObjectEvents::Publish(event);
    return event.result;
}

FileTransferResult SegmentTransfer::writeAndStore(const FileTransferRequest& request,
                                                  const StoredObject& event,
                                                  const StoreCredentials& credentials,
                                                  FileTransferInfo* info) {
    SegmentWriter::Report report;
    std::string error;
    if (!writer_.Write(request.video, request.audio, request.meta, &object_, &report, &error)) {
        Logger::Put(5, kFile, kFunction, __LINE__,
                    "cannot write stream file %" PRId64 " of %s as %s: %s", request.sequenceNumber,
                    request.streamingId.c_str(), format_.title.c_str(), error.c_str());
        return FileBroken;
    }
    if (report.dropped > 0)
        Logger::Put(5, kFile, kFunction, __LINE__,
                    "stream file %" PRId64
                    " of %s: %zu of %zu samples left out (unusable times, "
                    "payload or codec)",
                    request.sequenceNumber, request.streamingId.c_str(), report.dropped,
                    report.dropped + report.written);

    ObjectToStore object;
    object.bucket = event.bucket;
    object.key = event.key;
    object.contentType = format_.contentType;
    object.metadata = ObjectMetadata(request.streamingId, request.sequenceNumber, request.duration,
                                     event.captureMicros);
    object.data = object_.data();
    object.size = object_.size();
    if (!format_.initExtension.empty()) {
        const size_t media = SegmentFormat::FirstFragment(object_.data(), object_.size());
        if (media == 0) {
            Logger::Put(5, kFile, kFunction, __LINE__,
                        "stream file %" PRId64 " of %s: the %s object holds no fragment",
                        request.sequenceNumber, request.streamingId.c_str(), format_.title.c_str());
            return FileBroken;
        }
        const FileTransferResult stored = storeInit(request, event, media, credentials, info);
        if (stored != Success) return stored;
        object.data += media;
        object.size -= media;
    }

    FileTransferResult result = store_->Put(object, credentials, info);
    Logger::Put(13, kFile, kFunction, __LINE__, "%s/%s: %zu bytes, result %x",
                object.bucket.c_str(), object.key.c_str(), object.size,
                static_cast<unsigned>(result));
    return result;
}

FileTransferResult SegmentTransfer::storeInit(const FileTransferRequest& request,
                                              const StoredObject& event, size_t headerBytes,
                                              const StoreCredentials& credentials,
                                              FileTransferInfo* info) {
    if (!initKey_.empty() && init_.size() == headerBytes &&
        std::equal(init_.begin(), init_.end(), object_.begin()))
        return Success;
    ObjectToStore init;
    init.bucket = event.bucket;
    init.key = ObjectKey(keyPrefix_, request.streamingId, request.sequenceNumber,
                         event.captureMicros, format_.initExtension);
    init.contentType = format_.initContentType;
    init.metadata =
        ObjectMetadata(request.streamingId, request.sequenceNumber, 0, event.captureMicros);
    init.data = object_.data();
    init.size = headerBytes;
    const FileTransferResult result = store_->Put(init, credentials, info);
    Logger::Put(13, kFile, "SegmentTransfer::storeInit", __LINE__, "%s/%s: %zu bytes, result %x",
                init.bucket.c_str(), init.key.c_str(), init.size, static_cast<unsigned>(result));
    if (result != Success) return result;
    init_.assign(object_.begin(), object_.begin() + static_cast<std::ptrdiff_t>(headerBytes));
    initKey_ = init.key;
    return Success;
}
