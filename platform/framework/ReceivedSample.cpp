#include "platform/framework/ReceivedSample.h"

#include <cstring>

namespace {

void putLE(SampleAttributes::Block& block, size_t offset, uint64_t value, size_t bytes) {
    for (size_t i = 0; i < bytes; ++i) block[offset + i] = static_cast<uint8_t>(value >> (8 * i));
}

}  // namespace

SampleAttributes::Block SampleAttributes::Encode() const {
    Block block{};
    putLE(block, At::kRtpTime, rtpTime, 8);
    putLE(block, At::kTimestamp, timestamp, 8);
    putLE(block, At::kAttribute4, attribute4, 4);
    putLE(block, At::kAttribute5, attribute5, 4);
    block[At::kAttribute6] = attribute6 ? 1 : 0;
    putLE(block, At::kAttribute3, attribute3[0], 8);
    putLE(block, At::kAttribute3 + 8, attribute3[1], 8);
    putLE(block, At::kAttribute1, attribute1, 8);
    putLE(block, At::kAttribute2, attribute2, 8);
    putLE(block, At::kPayloadSize, payloadSize, 8);
    putLE(block, At::kAttribute7, attribute7, 8);
    return block;
}

ReceivedSample::ReceivedSample(const SampleAttributes::Block& attributes, const uint8_t* data,
                               size_t size, std::shared_ptr<const void> owner,
                               std::shared_ptr<const TrackDescription> track)
    : attributes_(attributes),
      data_(data),
      size_(size),
      owner_(std::move(owner)),
      track_(std::move(track)) {}

uint64_t ReceivedSample::ReadU64(size_t offset) const {
    uint64_t value = 0;
    for (size_t i = 0; i < 8; ++i)
        value |= static_cast<uint64_t>(attributes_[offset + i]) << (8 * i);
    return value;
}

uint32_t ReceivedSample::ReadU32(size_t offset) const {
    uint32_t value = 0;
    for (size_t i = 0; i < 4; ++i)
        value |= static_cast<uint32_t>(attributes_[offset + i]) << (8 * i);
    return value;
}

std::shared_ptr<ReceivedSample> MakeReceivedSample(SampleAttributes attributes, std::string payload,
                                                   std::shared_ptr<const TrackDescription> track) {
    auto owner = std::make_shared<const std::string>(std::move(payload));
    attributes.payloadSize = owner->size();
    const auto* data = reinterpret_cast<const uint8_t*>(owner->data());
    size_t size = owner->size();
    return std::make_shared<ReceivedSample>(attributes.Encode(), data, size, std::move(owner),
                                            std::move(track));
}
