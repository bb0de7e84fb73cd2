#include "platform/nal/StreamAnalyzer.h"

#include "platform/framework/StreamData.h"

namespace nal_access {
namespace {

// What the first slice of an access unit says.
enum class Verdict { KeepLooking, Idr, NotIdr };

// Annex B: the units follow start codes 00 00 01 (a leading zero of a 4-byte code is part of
// the previous unit's trailing bytes and harmless).
template <typename Classify>
bool walkAnnexB(const uint8_t* data, size_t size, Classify classify) {
    size_t i = 0;
    while (i + 3 <= size) {
        if (data[i] != 0 || data[i + 1] != 0 || data[i + 2] != 1) {
            ++i;
            continue;
        }
        const size_t nal = i + 3;
        if (nal >= size) return false;
        // Only the header bytes matter; the length of the unit is not needed.
        const Verdict v = classify(data + nal, size - nal);
        if (v != Verdict::KeepLooking) return v == Verdict::Idr;
        i = nal;
    }
    return false;
}

// Units each preceded by a 4-byte big-endian length.
template <typename Classify>
bool walkLengthPrefixed(const uint8_t* data, size_t size, Classify classify) {
    size_t pos = 0;
    while (pos + 4 <= size) {
        const uint32_t length = (uint32_t{data[pos]} << 24) | (uint32_t{data[pos + 1]} << 16) |
                                (uint32_t{data[pos + 2]} << 8) | uint32_t{data[pos + 3]};
        pos += 4;
        if (length == 0 || length > size - pos) return false;
        const Verdict v = classify(data + pos, length);
        if (v != Verdict::KeepLooking) return v == Verdict::Idr;
        pos += length;
    }
    return false;
}

// Calls `classify(firstByteOfNalHeader, bytesLeftInNal)` for each NAL unit in order until it
// returns a verdict. Unknown framing or a truncated unit ends the walk with NotIdr.
template <typename Classify>
bool walkNalUnits(const uint8_t* data, size_t size, Classify classify) {
    if (data == nullptr || size < 4) return false;
    const bool annexB = (data[0] == 0 && data[1] == 0 && data[2] == 1) ||
                        (data[0] == 0 && data[1] == 0 && data[2] == 0 && data[3] == 1);
    return annexB ? walkAnnexB(data, size, classify) : walkLengthPrefixed(data, size, classify);
}

Verdict classifyH264(const uint8_t* nal, size_t left) {
    if (left < 1 || (nal[0] & 0x80) != 0) return Verdict::NotIdr;  // forbidden_zero_bit
    unsigned type = nal[0] & 0x1F;
    if (type == 5) return Verdict::Idr;
    if (type >= 1 && type <= 4) return Verdict::NotIdr;  // coded slice / data partition
    return Verdict::KeepLooking;                         // SPS, PPS, SEI, AUD, ...
}

Verdict classifyH265(const uint8_t* nal, size_t left) {
    if (left < 2 || (nal[0] & 0x80) != 0) return Verdict::NotIdr;
    unsigned type = (nal[0] >> 1) & 0x3F;
    if (type == 19 || type == 20) return Verdict::Idr;
    if (type <= 31) return Verdict::NotIdr;  // any other VCL unit (CRA, BLA, TRAIL, ...)
    return Verdict::KeepLooking;             // VPS, SPS, PPS, SEI, AUD, ...
}

}  // namespace

bool StreamAnalyzer::IsIdrH264(const uint8_t* data, size_t size) {
    return walkNalUnits(data, size, classifyH264);
}

bool StreamAnalyzer::IsIdrH265(const uint8_t* data, size_t size) {
    return walkNalUnits(data, size, classifyH265);
}

bool StreamAnalyzer::IsIDR(const std::shared_ptr<StreamData>& data) {
    return data && IsIdrH264(data->PayloadData(), data->PayloadBytes());
}

bool StreamAnalyzer::IsIDR_H265(const std::shared_ptr<StreamData>& data) {
    return data && IsIdrH265(data->PayloadData(), data->PayloadBytes());
}

}  // namespace nal_access
