// SegmentTransfer: the transfer object that VqStreamFileTransfer::CreateInterface returns.
//
// Transfer turns the request's samples into one object of its segment format (SegmentWriter),
// names it (ObjectKey) and hands it to its store, then publishes what happened as an
// ObjectEvents event. One object serves one connection of the recorder: the writer's timeline
// offset is fixed by its first object, so the objects of one connection are continuous.
//
// A format whose objects need a header (fragmented MP4) has it cut off each object and stored
// under its own key (ObjectKey with the format's init ending) before the first object that
// needs it, and again whenever it changes (another set of tracks, new codec parameters); a
// failure to store it is the object's result. Events name it (StoredObject::initKey).
//
// Each published event names the store and the credentials of the Put (valid during the call),
// the run (a process-wide number of this transfer object), and whether the object's video comes
// from a new opening of the input.
//
// After a failed transfer the next one waits for the failure floor of RetryPolicy (a delay that
// doubles with each failure in a row and ends at once on Cancel), so that a store that keeps
// refusing, or a stream file the writer cannot take, is not tried in a tight loop.
//
// Results beyond the store's own: a request without samples (a gap) stores nothing, publishes
// nothing and is a Success with fileSize 0; samples the writer cannot turn into an object give
// FileBroken; after Cancel every Transfer returns TimeOut. Credentials go to the store only and
// are never logged.
//
// Threads: Transfer runs on one thread at a time (the recorder's upload thread); Cancel may
// come from any thread meanwhile and is forwarded to the store, which ends a running Put.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "platform/framework/ReceivedSample.h"
#include "platform/transfer/FileTransfer.h"
#include "platform/transfer/ObjectEvents.h"
#include "platform/transfer/ObjectStore.h"
#include "platform/transfer/RetryPacing.h"
#include "platform/transfer/SegmentFormat.h"
#include "platform/transfer/SegmentWriter.h"

class SegmentTransfer : public IFileTransfer {
  public:
    // `keyPrefix` is put in front of every object key as it is (no separator added).
    SegmentTransfer(std::shared_ptr<IObjectStore> store, std::string keyPrefix,
                    const SegmentFormat& format = SegmentFormat::Ts(),
                    RetryPolicy pacing = RetryPolicy());

    FileTransferResult Transfer(const FileTransferRequest& request,
                                FileTransferInfo* info) override;
    void Cancel() override;

  private:
    // Writes the object and stores it; fills event.size/responseTimeMs through `info`.
    FileTransferResult writeAndStore(const FileTransferRequest& request, const StoredObject& event,
                                     const StoreCredentials& credentials, FileTransferInfo* info);

    const std::shared_ptr<IObjectStore> store_;
    const std::string keyPrefix_;
    // For a format with an init segment: stores the first `headerBytes` of object_ as the run's
    // init segment unless the last one stored is the same.
    FileTransferResult storeInit(const FileTransferRequest& request, const StoredObject& event,
                                 size_t headerBytes, const StoreCredentials& credentials,
                                 FileTransferInfo* info);

    const SegmentFormat& format_;  // a process-wide constant
    SegmentWriter writer_;         // used by Transfer only
    std::vector<uint8_t> object_;  // the last object written; its capacity is reused
    FailureFloor floor_;           // used by Transfer only
    const uint64_t runId_;         // StoredObject::runId of this object's events
    // The track of the last video sample of the last object written: a first video sample of
    // another track means the input was opened again (StoredObject::newInput).
    std::shared_ptr<const TrackDescription> lastVideoTrack_;
    std::vector<uint8_t> init_;  // the init segment stored last (formats that have one)
    std::string initKey_;        // its key; "" before one was stored
    CancelSignal cancel_;        // raised by Cancel
};
