#include "platform/metrics/MetricsExporter.h"

#include <CivetServer.h>
#include <civetweb.h>
#include <prometheus/collectable.h>
#include <prometheus/counter.h>
#include <prometheus/exposer.h>
#include <prometheus/gauge.h>
#include <prometheus/histogram.h>
#include <prometheus/metric_family.h>
#include <prometheus/registry.h>

#include <cstring>
#include <exception>
#include <map>
#include <mutex>

#include "platform/logger/Logger.h"
#include "platform/transfer/ObjectEvents.h"

namespace {

constexpr const char* kFile = "platform/metrics/MetricsExporter";
const char* const kMediaNames[ProcessReadings::kMediaCount] = {"video", "audio", "meta"};

const char* stateName(VqProcessState state) {
    switch (state) {
        case Initializing:
            return "Initializing";
        case Initialized:
            return "Initialized";
        case Starting:
            return "Starting";
        case Executing:
            return "Executing";
        case Stopping:
            return "Stopping";
        case Warning:
            return "Warning";
        case Error:
            return "Error";
    }
    return "Unknown";
}

// The name FileTransfer gives a result, as the upload info lines show it.
const char* resultName(FileTransferResult result) {
    switch (result) {
        case Success:
            return "Success";
        case TimeOut:
            return "TimeOut";
        case AuthenticationError:
            return "AuthenticationError";
        case FilePathError:
            return "FilePathError";
        case FileBroken:
            return "FileBroken";
        case NetworkError:
            return "NetworkError";
        case RequestTimeTooSkewed:
            return "RequestTimeTooSkewed";
        case InternalError:
            return "InternalError";
        case OtherError:
            return "OtherError";
        default:
            return "Unnamed";
    }
}

// Brings a counter up to `total`, a count that only grows (the source's totals).
void raiseTo(prometheus::Counter& counter, uint64_t total) {
    const double value = static_cast<double>(total);
    if (value > counter.Value()) counter.Increment(value - counter.Value());
}

// A metric family registered in `registry`.
template <typename Metric>
prometheus::Family<Metric>& family(prometheus::detail::Builder<Metric> builder,
                                   prometheus::Registry& registry, const char* name,
                                   const char* help) {
    return builder.Name(name).Help(help).Register(registry);
}

// A metric without labels: its family's one member.
template <typename Metric>
Metric& single(prometheus::detail::Builder<Metric> builder, prometheus::Registry& registry,
               const char* name, const char* help) {
    return family(builder, registry, name, help).Add({});
}

}  // namespace

struct MetricsExporter::Impl : prometheus::Collectable {
    explicit Impl(std::function<ProcessReadings()> readingsSource)
        : source(std::move(readingsSource)),
          registry(std::make_shared<prometheus::Registry>()),
          files(family(prometheus::BuildCounter(), *registry, "recorder_objects_total",
                       "Stream files done, by result: Success is stored, any other result names "
                       "why the file was given up")),
          bytes(single(prometheus::BuildCounter(), *registry, "recorder_stored_bytes_total",
                       "Bytes of the objects stored")),
          transferSeconds(
              family(prometheus::BuildHistogram(), *registry, "recorder_transfer_seconds",
                     "Time the store took for one transfer attempt, whatever its result")
                  .Add({}, prometheus::Histogram::BucketBoundaries{0.01, 0.025, 0.05, 0.1, 0.25,
                                                                   0.5, 1, 2.5, 5, 10, 30})),
          attempts(family(prometheus::BuildCounter(), *registry, "recorder_transfer_attempts_total",
                          "Transfer attempts, by result")),
          bufferMs(single(prometheus::BuildGauge(), *registry, "recorder_file_buffer_ms",
                          "Milliseconds of stream in finished files waiting for the store")),
          bufferLimitMs(single(prometheus::BuildGauge(), *registry, "recorder_file_buffer_limit_ms",
                               "File buffer level at which files are given up (BufferOver)")),
          overflows(family(prometheus::BuildCounter(), *registry, "recorder_queue_overflows_total",
                           "Samples dropped because the module's queue was full, by media")),
          samples(family(prometheus::BuildCounter(), *registry, "recorder_samples_received_total",
                         "Samples handed to the module, by media")),
          reopenings(single(prometheus::BuildCounter(), *registry,
                            "recorder_input_reopenings_total",
                            "Times the live input was opened again after it failed or fell "
                            "silent")),
          rebases(single(prometheus::BuildCounter(), *registry, "recorder_clock_rebases_total",
                         "Jumps of the source's clock re-based onto the recording's timeline")),
          captureTime(single(prometheus::BuildGauge(), *registry,
                             "recorder_last_object_capture_time_seconds",
                             "Capture time of the first sample of the newest stored object, "
                             "seconds since the epoch")),
          state(single(prometheus::BuildGauge(), *registry, "recorder_process_state",
                       "Process state: 1 Initializing, 2 Initialized, 3 Starting, 4 Executing, 5 "
                       "Stopping, 6 Warning, 7 Error")),
          code(single(prometheus::BuildGauge(), *registry, "recorder_process_status_code",
                      "Code of the process state (the warning or error number; 0 none)")) {
        for (int media = 0; media < ProcessReadings::kMediaCount; ++media) {
            overflowCounters[media] = &overflows.Add({{"media", kMediaNames[media]}});
            sampleCounters[media] = &samples.Add({{"media", kMediaNames[media]}});
        }
    }

    // Uploading thread.
    void OnObject(const StoredObject& object) {
        transferSeconds.Observe(object.responseTimeMs / 1000.0);
        attempts.Add({{"result", resultName(object.result)}}).Increment();
        if (object.result != Success) return;
        bytes.Increment(static_cast<double>(object.size));
        const double captured = static_cast<double>(object.captureMicros) / 1e6;
        std::lock_guard<std::mutex> lock(refreshMutex);
        if (captured > captureTime.Value()) captureTime.Set(captured);
    }

    // Any thread: the source's totals into the metrics.
    void Refresh() const {
        const ProcessReadings r = source();
        std::lock_guard<std::mutex> lock(refreshMutex);
        for (const auto& [result, count] : r.files) raiseTo(files.Add({{"result", result}}), count);
        for (int media = 0; media < ProcessReadings::kMediaCount; ++media) {
            raiseTo(*overflowCounters[media], r.queueOverflows[media]);
            raiseTo(*sampleCounters[media], r.samplesReceived[media]);
        }
        bufferMs.Set(static_cast<double>(r.fileBufferMs));
        bufferLimitMs.Set(static_cast<double>(r.fileBufferLimitMs));
        raiseTo(reopenings, r.inputReopenings);
        raiseTo(rebases, r.clockRebases);
        state.Set(static_cast<double>(r.state));
        code.Set(static_cast<double>(r.code));
    }

    std::vector<prometheus::MetricFamily> Collect() const override {
        Refresh();
        return registry->Collect();
    }

    const std::function<ProcessReadings()> source;
    const std::shared_ptr<prometheus::Registry> registry;
    prometheus::Family<prometheus::Counter>& files;
    prometheus::Counter& bytes;
    prometheus::Histogram& transferSeconds;
    prometheus::Family<prometheus::Counter>& attempts;
    prometheus::Gauge& bufferMs;
    prometheus::Gauge& bufferLimitMs;
    prometheus::Family<prometheus::Counter>& overflows;
    prometheus::Family<prometheus::Counter>& samples;
    prometheus::Counter* overflowCounters[ProcessReadings::kMediaCount] = {};
    prometheus::Counter* sampleCounters[ProcessReadings::kMediaCount] = {};
    prometheus::Counter& reopenings;
    prometheus::Counter& rebases;
    prometheus::Gauge& captureTime;
    prometheus::Gauge& state;
    prometheus::Gauge& code;
    mutable std::mutex
        refreshMutex;  // one refresh at a time; the newest capture time's compare and set

    ObjectEvents::Subscription subscription;
    std::unique_ptr<prometheus::Exposer> exposer;
};

namespace {

// The exporter that answers /healthz, and the server's last complaint (for Serve's `why`).
// CivetWeb's callbacks carry no pointer of ours, so they find the exporter here.
std::mutex g_serverMutex;
const std::function<ProcessReadings()>* g_healthSource = nullptr;  // g_serverMutex
bool g_starting = false;           // a Serve is starting a server; guarded by g_serverMutex
std::string g_firstServerMessage;  // what the server said first while starting; g_serverMutex

// CivetWeb: before every request. Answers /healthz; 0 leaves every other URI to the Exposer.
int beginRequest(mg_connection* connection) {
    const mg_request_info* request = mg_get_request_info(connection);
    if (request == nullptr || request->local_uri == nullptr ||
        std::strcmp(request->local_uri, "/healthz") != 0)
        return 0;
    ProcessReadings readings;
    {
        std::lock_guard<std::mutex> lock(g_serverMutex);
        if (g_healthSource != nullptr) readings = (*g_healthSource)();
    }
    const bool healthy = readings.state == Executing || readings.state == Warning;
    const std::string body =
        std::string(stateName(readings.state)) + " " + std::to_string(readings.code) + "\n";
    const int status = healthy ? 200 : 503;
    mg_printf(connection,
              "HTTP/1.1 %d %s\r\nContent-Type: text/plain\r\nCache-Control: no-store\r\n"
              "Content-Length: %zu\r\nConnection: close\r\n\r\n%s",
              status, healthy ? "OK" : "Service Unavailable", body.size(), body.c_str());
    return status;
}

// CivetWeb's own messages: into the log rather than onto stderr. While a server starts, the
// first one is kept for Serve to tell why it failed, in its one line.
int logMessage(const mg_connection*, const char* message) {
    const std::string text = message != nullptr ? message : "";
    {
        std::lock_guard<std::mutex> lock(g_serverMutex);
        if (g_starting) {
            if (g_firstServerMessage.empty()) g_firstServerMessage = text;
            return 1;
        }
    }
    Logger::Put(5, kFile, "MetricsExporter", __LINE__, "metrics server: %s", text.c_str());
    return 1;
}

}  // namespace

MetricsExporter::MetricsExporter(std::function<ProcessReadings()> source)
    : impl_(std::make_shared<Impl>(std::move(source))) {
    std::weak_ptr<Impl> weak = impl_;
    impl_->subscription = ObjectEvents::Subscribe([weak](const StoredObject& object) {
        if (auto impl = weak.lock()) impl->OnObject(object);
    });
}

MetricsExporter::~MetricsExporter() {
    {
        std::lock_guard<std::mutex> lock(g_serverMutex);
        if (g_healthSource == &impl_->source) g_healthSource = nullptr;
    }
    impl_->exposer.reset();  // waits for the requests in progress
    impl_->subscription.Reset();
}

bool MetricsExporter::Serve(const std::string& address, std::string* why) {
    CivetCallbacks callbacks;
    callbacks.begin_request = beginRequest;
    callbacks.log_message = logMessage;
    {
        std::lock_guard<std::mutex> lock(g_serverMutex);
        g_starting = true;
        g_firstServerMessage.clear();
    }
    std::string failure;
    try {
        impl_->exposer = std::make_unique<prometheus::Exposer>(
            std::vector<std::string>{"listening_ports", address, "num_threads", "2"}, &callbacks);
        impl_->exposer->RegisterCollectable(impl_);
    } catch (const std::exception& e) {
        failure = e.what();
        impl_->exposer.reset();
    }
    std::lock_guard<std::mutex> lock(g_serverMutex);
    g_starting = false;
    if (!impl_->exposer) {
        *why = "-metrics " + address + ": cannot serve there: " +
               (g_firstServerMessage.empty() ? failure : g_firstServerMessage);
        return false;
    }
    g_healthSource = &impl_->source;
    return true;
}

std::vector<prometheus::MetricFamily> MetricsExporter::Collect() const {
    return impl_->Collect();
}
