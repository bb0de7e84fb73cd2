// The metrics exporter: what the object events and the process's readings turn into, read from
// the registry as a scrape would; /healthz by process state; an address it cannot listen at.
#include <gtest/gtest.h>
#include <prometheus/text_serializer.h>
#include <sys/socket.h>

#include <mutex>
#include <string>
#include <vector>

#include "platform/metrics/MetricsExporter.h"
#include "platform/transfer/ObjectEvents.h"
#include "tests/support/TestSupport.h"

namespace {

StoredObject Object(FileTransferResult result, uint64_t size, uint32_t responseMs,
                    uint64_t captureMicros) {
    StoredObject o;
    o.result = result;
    o.size = size;
    o.responseTimeMs = responseMs;
    o.captureMicros = captureMicros;
    return o;
}

ProcessReadings Readings(VqProcessState state, unsigned code) {
    ProcessReadings r;
    r.state = state;
    r.code = code;
    return r;
}

}  // namespace

TEST(MetricsExporterTest, EventsAndReadingsBecomeMetricValues) {
    ProcessReadings busy = Readings(Warning, 26);
    busy.files = {{"Success", 3}, {"BufferOver", 2}};
    busy.samplesReceived[ProcessReadings::kVideo] = 300;
    busy.samplesReceived[ProcessReadings::kAudio] = 470;
    busy.queueOverflows[ProcessReadings::kMeta] = 4;
    busy.fileBufferMs = 12000;
    busy.fileBufferLimitMs = 60000;
    busy.inputReopenings = 2;
    busy.clockRebases = 1;
    const struct {
        const char* what;
        std::vector<StoredObject> events;
        ProcessReadings readings;
        std::vector<std::pair<std::string, double>> expected;  // as a scrape shows them
    } cases[] = {
        {"failed attempts store no bytes; an older object leaves the capture time",
         {Object(Success, 10, 100, 9'000'000), Object(NetworkError, 0, 3000, 10'000'000),
          Object(NetworkError, 0, 1000, 10'000'000), Object(Success, 20, 100, 5'000'000)},
         Readings(Executing, 0),
         {{"recorder_stored_bytes_total", 30},
          {"recorder_transfer_seconds_count", 4},
          {"recorder_transfer_seconds_sum", 4.2},
          {"recorder_transfer_attempts_total{result=\"NetworkError\"}", 2},
          {"recorder_transfer_attempts_total{result=\"Success\"}", 2},
          {"recorder_last_object_capture_time_seconds", 9},
          {"recorder_process_state", 4}}},
        {"the process's readings",
         {},
         busy,
         {{"recorder_objects_total{result=\"Success\"}", 3},
          {"recorder_objects_total{result=\"BufferOver\"}", 2},
          {"recorder_samples_received_total{media=\"video\"}", 300},
          {"recorder_samples_received_total{media=\"audio\"}", 470},
          {"recorder_samples_received_total{media=\"meta\"}", 0},
          {"recorder_queue_overflows_total{media=\"meta\"}", 4},
          {"recorder_queue_overflows_total{media=\"video\"}", 0},
          {"recorder_file_buffer_ms", 12000},
          {"recorder_file_buffer_limit_ms", 60000},
          {"recorder_input_reopenings_total", 2},
          {"recorder_clock_rebases_total", 1},
          {"recorder_process_state", 6},
          {"recorder_process_status_code", 26},
          {"recorder_stored_bytes_total", 0},
          {"recorder_transfer_seconds_count", 0}}},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        MetricsExporter exporter([&c] { return c.readings; });
        for (const auto& event : c.events) ObjectEvents::Publish(event);
        auto samples =
            testsupport::Samples(prometheus::TextSerializer().Serialize(exporter.Collect()));
        for (const auto& [name, value] : c.expected) {
            ASSERT_EQ(samples.count(name), 1u) << name;
            EXPECT_DOUBLE_EQ(samples[name], value) << name;
        }
    }
}

// /healthz is 200 while the process records (Executing, Warning) and 503 in any other state;
// a second server on the same address fails with the reason.
TEST(MetricsExporterTest, HealthFollowsTheProcessStateAndABusyAddressFailsToServe) {
    std::mutex mutex;
    ProcessReadings now;
    MetricsExporter exporter([&] {
        std::lock_guard<std::mutex> lock(mutex);
        return now;
    });
    const std::string address = "127.0.0.1:" + std::to_string(testsupport::FreePort(SOCK_STREAM));
    std::string why;
    ASSERT_TRUE(exporter.Serve(address, &why)) << why;
    const struct {
        VqProcessState state;
        unsigned code;
        std::string answer;  // the body, then the status
    } cases[] = {
        {Initialized, 0, "Initialized 0\n503"},
        {Executing, 0, "Executing 0\n200"},
        {Warning, 26, "Warning 26\n200"},
        {Error, 21, "Error 21\n503"},
    };
    for (const auto& c : cases) {
        {
            std::lock_guard<std::mutex> lock(mutex);
            now = Readings(c.state, c.code);
        }
        auto r = testsupport::RunProcess(
            {"curl", "-s", "-w", "%{http_code}", "http://" + address + "/healthz"});
        EXPECT_EQ(r.output, c.answer);
    }
    MetricsExporter second([] { return ProcessReadings(); });
    EXPECT_FALSE(second.Serve(address, &why));
    EXPECT_NE(why.find("Address already in use"), std::string::npos) << why;
}
