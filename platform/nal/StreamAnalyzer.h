// nal_access::StreamAnalyzer: tells whether a video access unit holds an IDR picture.
//
// Reads the payload through the sample's `source`. Accepts Annex B (3- or 4-byte start codes)
// or, when the payload does not begin with a start code, 4-byte big-endian length prefixes.
// The first slice NAL unit of the access unit decides, so the cost does not grow with the size
// of the picture. H.264: nal_unit_type 5. H.265: 19 (IDR_W_RADL) and 20 (IDR_N_LP); a CRA is
// not an IDR. Stateless: concurrent calls on one object are safe. Truncated or garbage bytes
// give false and are never read past.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>

class StreamData;

namespace nal_access {

class StreamAnalyzer {
  public:
    StreamAnalyzer() = default;
    virtual ~StreamAnalyzer() = default;

    bool IsIDR(const std::shared_ptr<StreamData>& data);
    bool IsIDR_H265(const std::shared_ptr<StreamData>& data);

    // The same tests on raw bytes.
    static bool IsIdrH264(const uint8_t* data, size_t size);
    static bool IsIdrH265(const uint8_t* data, size_t size);
};

}  // namespace nal_access
