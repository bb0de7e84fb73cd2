// StreamData: one media sample on its way through the recorder.
//
// Built from a ReceivedSample by the receive callbacks and shared by std::shared_ptr between
// the media queues, the IDR test and the stream buffer; stream files hold copies. A copy is
// member-wise and shares `source`, so payload bytes are never copied: they stay owned by the
// ReceivedSample as long as any copy lives. Field order and widths are fixed because the IDR
// analyzer and the file transfer library read the record too.
//
// A default-constructed record (payloadSize 0) is the marker sample the module's queues use
// to wake their workers.
#pragma once

#include <cstdint>
#include <memory>

class ReceivedSample;

class StreamData {
  public:
    StreamData() = default;
    explicit StreamData(std::shared_ptr<ReceivedSample> sample);
    StreamData(const StreamData&) = default;
    StreamData& operator=(const StreamData&) = default;
    virtual ~StreamData() = default;

    uint64_t rtpTime = 0;    // sample time in its own media clock
    uint64_t timestamp = 0;  // ms on the clock that video, audio and meta share
    uint64_t attribute1 = 0;
    uint64_t attribute2 = 0;
    uint64_t attribute3[2] = {0, 0};   // one 16-byte unit
    std::shared_ptr<void> dataHolder;  // empty in every record the recorder makes
    uint64_t payloadSize = 0;          // bytes; 0 marks a marker sample
    uint32_t attribute4 = 0;
    uint32_t attribute5 = 0;
    bool attribute6 = true;
    std::shared_ptr<ReceivedSample> source;  // owns the payload
    uint64_t attribute7 = 0;

    // Payload bytes (through `source`); null/0 for a marker.
    const uint8_t* PayloadData() const;
    size_t PayloadBytes() const;
};
