// StreamData. Guards: an attribute read from the wrong byte offset (or bytes between fields
// leaking into one), and a payload copied or released while a stream file still holds it.
#include <gtest/gtest.h>

#include <tuple>

#include "platform/framework/ReceivedSample.h"
#include "platform/framework/StreamData.h"
#include "tests/support/TestSupport.h"

TEST(StreamDataFromSample, ReadsEveryFieldAtItsBytePosition) {
    SampleAttributes a;
    a.rtpTime = 0x0102030405060708ull;
    a.timestamp = 0x1112131415161718ull;
    a.attribute4 = 0x21222324u;
    a.attribute5 = 0x31323334u;
    a.attribute6 = false;
    a.attribute3[0] = 0x4142434445464748ull;
    a.attribute3[1] = 0x5152535455565758ull;
    a.attribute1 = 0x6162636465666768ull;
    a.attribute2 = 0x7172737475767778ull;
    a.attribute7 = 0x8182838485868788ull;
    auto block = a.Encode();
    EXPECT_EQ(block[0], 0x08);  // little-endian
    EXPECT_EQ(block[15], 0x11);

    auto sample = MakeReceivedSample(a, "abcde", nullptr);
    StreamData d(sample);
    EXPECT_EQ(std::tie(d.rtpTime, d.timestamp, d.attribute4, d.attribute5, d.attribute6,
                       d.attribute3[0], d.attribute3[1], d.attribute1, d.attribute2, d.attribute7),
              std::tie(a.rtpTime, a.timestamp, a.attribute4, a.attribute5, a.attribute6,
                       a.attribute3[0], a.attribute3[1], a.attribute1, a.attribute2, a.attribute7));
    EXPECT_EQ(d.payloadSize, 5u);
    EXPECT_EQ(d.source, sample);
}

TEST(StreamDataFromSample, UnreadBytesDoNotLeakIntoFields) {
    SampleAttributes::Block block{};
    for (size_t i = 16; i < 24; ++i) block[i] = 0xFF;
    for (size_t i = 33; i < 48; ++i) block[i] = 0xFF;
    auto sample = std::make_shared<ReceivedSample>(block, nullptr, 0, nullptr, nullptr);
    StreamData d(sample);
    EXPECT_EQ(d.timestamp, 0u);
    EXPECT_EQ(d.attribute4, 0u);
    EXPECT_EQ(d.attribute3[0], 0u);
    EXPECT_FALSE(d.attribute6);
}

TEST(StreamDataLifetime, ACopyKeepsThePayloadAliveAndSharesItsBytes) {
    auto received = testsupport::MakeReceived(10, 900, "payload");
    const uint8_t* bytes = received->Data();
    std::weak_ptr<ReceivedSample> watch = received;
    auto queued = std::make_shared<StreamData>(std::move(received));
    StreamData inFile = *queued;  // as a stream file holds it
    queued.reset();
    ASSERT_FALSE(watch.expired());
    EXPECT_EQ(inFile.PayloadData(), bytes);
    EXPECT_EQ(
        std::string(reinterpret_cast<const char*>(inFile.PayloadData()), inFile.PayloadBytes()),
        "payload");
    inFile = StreamData();  // a marker: no payload
    EXPECT_TRUE(watch.expired());
    EXPECT_TRUE(inFile.attribute6);
    EXPECT_EQ(inFile.PayloadData(), nullptr);
}
