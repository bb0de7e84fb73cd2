#include "platform/framework/StreamData.h"

#include "platform/framework/ReceivedSample.h"

using At = SampleAttributes::At;

StreamData::StreamData(std::shared_ptr<ReceivedSample> sample)
    : rtpTime(sample->ReadU64(At::kRtpTime)),
      timestamp(sample->ReadU64(At::kTimestamp)),
      attribute1(sample->ReadU64(At::kAttribute1)),
      attribute2(sample->ReadU64(At::kAttribute2)),
      attribute3{sample->ReadU64(At::kAttribute3), sample->ReadU64(At::kAttribute3 + 8)},
      payloadSize(sample->ReadU64(At::kPayloadSize)),
      attribute4(sample->ReadU32(At::kAttribute4)),
      attribute5(sample->ReadU32(At::kAttribute5)),
      attribute6(sample->Attributes()[At::kAttribute6] != 0),
      source(std::move(sample)),
      attribute7(source->ReadU64(At::kAttribute7)) {}

const uint8_t* StreamData::PayloadData() const {
    return source ? source->Data() : nullptr;
}

size_t StreamData::PayloadBytes() const {
    return source ? source->Size() : 0;
}
