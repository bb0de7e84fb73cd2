#include "platform/framework/StreamData.h"

#include "platform/framework/ReceivedSample.h"

StreamData::StreamData(std::shared_ptr<ReceivedSample> sample)
    : rtpTime(sample->ReadU64(0)),
      timestamp(sample->ReadU64(8)),
      attribute1(sample->ReadU64(64)),
      attribute2(sample->ReadU64(72)),
      attribute3{sample->ReadU64(48), sample->ReadU64(56)},
      payloadSize(sample->ReadU64(80)),
      attribute4(sample->ReadU32(24)),
      attribute5(sample->ReadU32(28)),
      attribute6(sample->Attributes()[32] != 0),
      source(std::move(sample)),
      attribute7(source->ReadU64(88)) {}

const uint8_t* StreamData::PayloadData() const {
    return source ? source->Data() : nullptr;
}

size_t StreamData::PayloadBytes() const {
    return source ? source->Size() : 0;
}
