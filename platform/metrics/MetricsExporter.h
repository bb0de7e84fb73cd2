// MetricsExporter: serves the recorder's metrics in the Prometheus text format at /metrics, and
// its health at /healthz, over HTTP (prometheus-cpp's registry and Exposer).
//
// Where the numbers come from:
//   - the object events (ObjectEvents, on the uploading thread, once per transfer attempt):
//     bytes stored, the transfer time histogram, the capture time of the newest stored object;
//   - `source`, read when a scrape comes: the process state and code, the stream files done by
//     result, samples received and queue overflows by media, the file buffer's level and
//     limit, input reopenings and clock re-basings. These are totals the process keeps anyway
//     (relaxed atomic counts on the sample path), so the exporter adds nothing per sample, and a
//     scrape sees them as they are rather than as of the last event.
//
// /healthz answers 200 while the process state is Executing or Warning (recording; a warning,
// such as a slow store, is in the code), and 503 in every other state (starting, stopping,
// Error); the body is the state's name and code, one line.
//
// Threads: construction, Serve and destruction on one thread; Collect on any thread, among
// them the server's (two) threads, concurrently. The destructor stops the server (waiting for
// requests in progress) before it lets go of the source. The metrics themselves are
// prometheus-cpp's, thread-safe; the refresh from `source` is serialised by a mutex of its own.
// One exporter at a time serves /healthz in a process: the one whose Serve succeeded last.
#pragma once

#include <functional>
#include <memory>
#include <string>
#include <vector>

#include "platform/framework/ProcessReadings.h"

namespace prometheus {
struct MetricFamily;
}

class MetricsExporter {
  public:
    // `source` is called on the server's threads during a scrape or a health check; it must
    // stay callable until the exporter is destroyed, and must not block for long.
    explicit MetricsExporter(std::function<ProcessReadings()> source);
    ~MetricsExporter();
    MetricsExporter(const MetricsExporter&) = delete;
    MetricsExporter& operator=(const MetricsExporter&) = delete;

    // Starts serving at `address` ("127.0.0.1:9464", "[::1]:9464"). False, with `why` in one
    // line, when the server cannot listen there (address in use, not local). Once only.
    bool Serve(const std::string& address, std::string* why);

    // Every metric family with its current values, as a scrape would see them now.
    std::vector<prometheus::MetricFamily> Collect() const;

  private:
    struct Impl;
    std::shared_ptr<Impl> impl_;
};
