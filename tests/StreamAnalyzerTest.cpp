// StreamAnalyzer and NalAnalyzer. Guards: a key frame missed or invented in real H.264/H.265
// streams in any framing (3- or 4-byte start codes, length prefixes), an HEVC CRA taken for an
// IDR, one codec's rules applied to the other, reads past the end of truncated or random input,
// and the codec type selecting the wrong parser.
#include "platform/nal/StreamAnalyzer.h"

extern "C" {
#include <libavformat/avformat.h>
}

#include <gtest/gtest.h>

#include <random>
#include <string>
#include <vector>

#include "platform/framework/StreamData.h"
#include "src/NalAnalyzer.h"
#include "tests/support/TestSupport.h"

using nal_access::StreamAnalyzer;

namespace {

// Access units of a raw Annex B elementary stream, as FFmpeg's parser splits them.
std::vector<std::string> accessUnits(const std::string& path) {
    std::vector<std::string> units;
    AVFormatContext* ctx = nullptr;
    if (avformat_open_input(&ctx, path.c_str(), nullptr, nullptr) < 0) return units;
    AVPacket* pkt = av_packet_alloc();
    while (av_read_frame(ctx, pkt) >= 0) {
        units.emplace_back(reinterpret_cast<const char*>(pkt->data), pkt->size);
        av_packet_unref(pkt);
    }
    av_packet_free(&pkt);
    avformat_close_input(&ctx);
    return units;
}

// One second of 10 fps test picture with a key frame every fifth picture, no B frames.
std::vector<std::string> encoded(const char* file, std::vector<std::string> codecArgs) {
    std::vector<std::string> args = {"-f", "lavfi", "-i",
                                     "testsrc2=size=128x96:rate=10:duration=1"};
    args.insert(args.end(), codecArgs.begin(), codecArgs.end());
    return accessUnits(testsupport::MediaClip(file, args));
}
std::vector<std::string> h264Units() {
    return encoded("analyzer.h264",
                   {"-c:v", "libx264", "-preset", "ultrafast", "-g", "5", "-keyint_min", "5",
                    "-sc_threshold", "0", "-bf", "0", "-f", "h264"});
}
std::vector<std::string> h265Units(bool openGop) {
    return encoded(openGop ? "analyzer-cra.hevc" : "analyzer-idr.hevc",
                   {"-c:v", "libx265", "-x265-params",
                    std::string("keyint=5:min-keyint=5:scenecut=0:bframes=0:log-level=error:") +
                        (openGop ? "open-gop=1" : "open-gop=0"),
                    "-f", "hevc"});
}

bool h264(const std::string& au) {
    return StreamAnalyzer::IsIdrH264(reinterpret_cast<const uint8_t*>(au.data()), au.size());
}
bool h265(const std::string& au) {
    return StreamAnalyzer::IsIdrH265(reinterpret_cast<const uint8_t*>(au.data()), au.size());
}

// Splits an Annex B unit at its start codes into NAL units (a NAL unit never ends in a zero
// byte, so trailing zeros belong to the next four-byte start code).
std::vector<std::string> nalUnits(const std::string& au) {
    const std::string code("\0\0\1", 3);
    std::vector<std::string> nals;
    for (size_t at = au.find(code); at != std::string::npos;) {
        size_t next = au.find(code, at + 3);
        nals.push_back(au.substr(at + 3, next == std::string::npos ? next : next - at - 3));
        while (!nals.back().empty() && nals.back().back() == 0) nals.back().pop_back();
        at = next;
    }
    return nals;
}

std::string withStartCodes(const std::vector<std::string>& nals, size_t codeBytes) {
    std::string out;
    for (const auto& n : nals) out += std::string(codeBytes - 1, '\0') + '\1' + n;
    return out;
}

std::string lengthPrefixed(const std::vector<std::string>& nals) {
    std::string out;
    for (const auto& n : nals) {
        for (int shift = 24; shift >= 0; shift -= 8) out += static_cast<char>(n.size() >> shift);
        out += n;
    }
    return out;
}

}  // namespace

// Real streams with a key frame every fifth access unit; every framing gives the same answer.
TEST(StreamAnalyzerRealStreams, IdrEveryFifthUnitInAnyFraming) {
    const std::pair<const char*, bool (*)(const std::string&)> codecs[] = {{"h264", h264},
                                                                           {"h265", h265}};
    for (const auto& [name, isIdr] : codecs) {
        SCOPED_TRACE(name);
        auto units = name == std::string("h264") ? h264Units() : h265Units(false);
        ASSERT_EQ(units.size(), 10u);
        for (size_t i = 0; i < units.size(); ++i) {
            SCOPED_TRACE(i);
            auto nals = nalUnits(units[i]);
            EXPECT_EQ(isIdr(units[i]), i % 5 == 0);
            EXPECT_EQ(isIdr(withStartCodes(nals, 3)), i % 5 == 0);
            EXPECT_EQ(isIdr(withStartCodes(nals, 4)), i % 5 == 0);
            EXPECT_EQ(isIdr(lengthPrefixed(nals)), i % 5 == 0);
        }
    }
    auto cra = h265Units(true);
    ASSERT_EQ(cra.size(), 10u);
    EXPECT_TRUE(h265(cra[0]));   // the stream opens with an IDR
    EXPECT_FALSE(h265(cra[5]));  // a later key frame is a CRA picture
    // One codec's rules never apply to the other.
    EXPECT_FALSE(h264(h265Units(false)[1]));
    EXPECT_FALSE(h265(h264Units()[1]));
}

TEST(StreamAnalyzerBadInput, TruncatedOrRandomBytesGiveFalseWithoutOverread) {
    auto idr = h264Units()[0];
    // Every prefix of a real IDR unit, each in its own exactly-sized heap block so that ASan
    // sees any read past the end. Prefixes that still hold the slice header may say true.
    size_t sliceStart = idr.find(std::string("\x00\x00\x01\x65", 4));
    ASSERT_NE(sliceStart, std::string::npos);
    for (size_t n = 0; n <= idr.size(); ++n) {
        std::vector<uint8_t> prefix(idr.begin(), idr.begin() + static_cast<long>(n));
        bool result = StreamAnalyzer::IsIdrH264(prefix.data(), prefix.size());
        EXPECT_TRUE(n > sliceStart + 3 || !result) << "prefix " << n;
        StreamAnalyzer::IsIdrH265(prefix.data(), prefix.size());
    }
    auto lp = lengthPrefixed(nalUnits(idr));
    for (size_t n = 0; n < lp.size(); ++n) {
        std::vector<uint8_t> prefix(lp.begin(), lp.begin() + static_cast<long>(n));
        StreamAnalyzer::IsIdrH264(prefix.data(), prefix.size());
    }
    std::mt19937 rng(1234);
    for (int round = 0; round < 20000; ++round) {
        std::vector<uint8_t> bytes(rng() % 64);
        for (auto& b : bytes) b = static_cast<uint8_t>(rng() % 4 == 0 ? 0 : rng());
        StreamAnalyzer::IsIdrH264(bytes.data(), bytes.size());
        StreamAnalyzer::IsIdrH265(bytes.data(), bytes.size());
    }
    EXPECT_FALSE(StreamAnalyzer::IsIdrH264(nullptr, 0));
    // A length prefix larger than the payload.
    std::string lying("\x00\x00\x10\x00\x65\x88", 6);
    EXPECT_FALSE(h264(lying));
}

TEST(NalAnalyzerOnSamples, CodecTypeOneSelectsH265AnyOtherH264AndMarkersAreNoIdr) {
    auto h264Idr = testsupport::MakeSample(0, 0, testsupport::H264Idr());
    auto h265Idr = testsupport::MakeSample(0, 0, testsupport::H265Idr());
    StreamAnalyzer analyzer;
    EXPECT_FALSE(analyzer.IsIDR(testsupport::MakeSample(0, 0, testsupport::H264NonIdr())));
    EXPECT_FALSE(analyzer.IsIDR_H265(testsupport::MakeSample(0, 0, testsupport::H265NonIdr())));
    EXPECT_FALSE(analyzer.IsIDR(std::make_shared<StreamData>()));
    EXPECT_FALSE(analyzer.IsIDR(nullptr));
    Orvane::NalAnalyzer hevc(1);
    EXPECT_TRUE(hevc.IsIDR(h265Idr));
    EXPECT_FALSE(hevc.IsIDR(h264Idr));
    for (int type : {0, 2, -1}) {
        Orvane::NalAnalyzer avc(type);
        EXPECT_TRUE(avc.IsIDR(h264Idr)) << type;
        EXPECT_FALSE(avc.IsIDR(h265Idr)) << type;
    }
}
