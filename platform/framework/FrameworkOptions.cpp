#include "platform/framework/FrameworkOptions.h"

#include <arpa/inet.h>

#include <cstdlib>
#include <mutex>

namespace {

std::string envOr(const char* name, const std::string& fallback) {
    const char* v = std::getenv(name);
    return (v != nullptr && *v != '\0') ? std::string(v) : fallback;
}

std::string baseName(const std::string& input) {
    std::string s = input;
    auto q = s.find_first_of("?#");
    if (q != std::string::npos) s.resize(q);
    while (!s.empty() && s.back() == '/') s.pop_back();
    auto slash = s.find_last_of('/');
    if (slash != std::string::npos) s = s.substr(slash + 1);
    auto dot = s.find_last_of('.');
    if (dot != std::string::npos && dot > 0) s.resize(dot);
    std::string out;
    for (char c : s) {
        bool ok = (c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
                  c == '-' || c == '_' || c == '.';
        out += ok ? c : '_';
    }
    return out.empty() ? std::string("stream") : out;
}

// "IPv4:PORT" or "[IPv6]:PORT" with a port from 1 to 65535: what the metrics server can bind.
bool isListenAddress(const std::string& text) {
    const auto colon = text.rfind(':');
    if (colon == std::string::npos) return false;
    const std::string host = text.substr(0, colon);
    int port = 0;
    if (!CommandLine::ParseInt(text.substr(colon + 1), port) || port < 1 || port > 65535)
        return false;
    unsigned char address[sizeof(in6_addr)];
    if (host.size() > 2 && host.front() == '[' && host.back() == ']')
        return inet_pton(AF_INET6, host.substr(1, host.size() - 2).c_str(), address) == 1;
    return inet_pton(AF_INET, host.c_str(), address) == 1;
}

std::mutex g_optionsMutex;
FrameworkOptions g_options;

}  // namespace

FrameworkOptions FrameworkOptions::Read(const CommandLine& cl, std::vector<std::string>& errors) {
    FrameworkOptions o;
    std::string v;
    auto readNumber = [&](const char* name, double& field, double minimum) {
        if (!cl.Find(name, v)) return;
        double parsed = 0;
        if (!CommandLine::ParseDouble(v, parsed) || parsed < minimum) {
            errors.push_back(std::string("-") + name + " needs a number of at least " +
                             std::to_string(static_cast<int>(minimum)) + ", got \"" + v + "\"");
            return;
        }
        field = parsed;
    };
    o.input = envOr("SFR_INPUT_URL", "");
    cl.Find("input", o.input);
    o.streamingId = o.input.empty() ? std::string() : baseName(o.input);
    cl.Find("streamingid", o.streamingId);
    cl.Find("parent", o.parent);
    readNumber("readrate", o.readRate, 0);
    readNumber("duration", o.durationSeconds, 0);
    readNumber("draintimeout", o.drainTimeoutSeconds, 0);
    o.endpoint = envOr("AWS_ENDPOINT_URL_S3", envOr("AWS_ENDPOINT_URL", ""));
    cl.Find("endpoint", o.endpoint);
    o.region = envOr("AWS_REGION", envOr("AWS_DEFAULT_REGION", "us-east-1"));
    o.regionSource = !envOr("AWS_REGION", "").empty()           ? "AWS_REGION"
                     : !envOr("AWS_DEFAULT_REGION", "").empty() ? "AWS_DEFAULT_REGION"
                                                                : "the default";
    if (cl.Find("region", o.region)) o.regionSource = "-region";
    cl.Find("credentialprocess", o.credentialProcess);
    cl.Find("segmentformat", o.segmentFormat);
    if (o.segmentFormat != "ts" && o.segmentFormat != "fmp4") {
        errors.push_back("-segmentformat needs ts or fmp4, got \"" + o.segmentFormat + "\"");
    }
    cl.Find("keyprefix", o.keyPrefix);
    if (cl.Find("playlist", v)) {
        if (v != "on" && v != "off")
            errors.push_back("-playlist needs on or off, got \"" + v + "\"");
        o.playlist = v != "off";
    }
    if (cl.Find("loglevel", v) && !CommandLine::ParseInt(v, o.logLevel)) {
        errors.push_back("-loglevel needs a whole number, got \"" + v + "\"");
        o.logLevel = 11;
    }
    cl.Find("logfile", o.logFile);
    cl.Find("status", o.statusPath);
    if (cl.Find("metrics", o.metrics) && !isListenAddress(o.metrics)) {
        errors.push_back("-metrics needs IP:PORT (127.0.0.1:9464, [::1]:9464), got \"" + o.metrics +
                         "\"");
        o.metrics.clear();
    }
    o.upload = UploadOptions::Read(cl, errors);
    return o;
}

std::vector<OptionHelp> FrameworkOptions::Help() {
    return {
        {"input", "URL", "SFR_INPUT_URL",
         "the stream to record: a file, or any URL FFmpeg opens (rtsp://, srt://, udp://, "
         "rtmp://, http(s)://)"},
        {"streamingid", "ID", "the input's base name", "the stream's name in keys and messages"},
        {"endpoint", "URL", "AWS_ENDPOINT_URL_S3, AWS_ENDPOINT_URL, else AWS",
         "where objects go: https://host[:port], http://127.0.0.1:port, or file:///dir"},
        {"region", "R", "AWS_REGION, AWS_DEFAULT_REGION, else us-east-1", "the bucket's region"},
        {"credentialprocess", "CMD", "none",
         "command that prints AWS credential_process JSON (else AWS_ACCESS_KEY_ID, "
         "AWS_SECRET_ACCESS_KEY, AWS_SESSION_TOKEN)"},
        {"keyprefix", "P", "empty", "prefix of every object key"},
        {"sse", "AES256|aws:kms", "the bucket's", "server-side encryption"},
        {"ssekmskeyid", "KEY", "the AWS managed key", "KMS key with -sse aws:kms"},
        {"storageclass", "CLASS", "STANDARD", "storage class of the objects"},
        {"acl", "ACL", "none", "canned ACL, e.g. bucket-owner-full-control"},
        {"tagging", "K=V&...", "none", "tags of every object"},
        {"addressing", "auto|path|virtual", "auto", "bucket addressing style"},
        {"segmentformat", "ts|fmp4", "ts",
         "object format: MPEG-TS, or fragmented MP4 (CMAF) with an init segment per run"},
        {"playlist", "on|off", "on", "HLS playlists beside the objects (live.m3u8, hourly)"},
        {"readrate", "R", "1 for files", "pace a file at R times real time; 0 reads at once"},
        {"duration", "S", "none", "end after S seconds of input"},
        {"draintimeout", "S", "30", "at the end, store what is held for at most S seconds"},
        {"parent", "NAME", "host", "destination of every message"},
        {"status", "PATH", "stdout", "where the messages go, one JSON object per line"},
        {"metrics", "IP:PORT", "off", "serve Prometheus /metrics and /healthz there"},
        {"logfile", "PATH", "stderr", "log destination"},
        {"loglevel", "N", "11", "log lines with a priority number above N are not written"},
    };
}

FrameworkOptions CurrentFrameworkOptions() {
    std::lock_guard<std::mutex> lock(g_optionsMutex);
    return g_options;
}

void SetCurrentFrameworkOptions(const FrameworkOptions& options) {
    std::lock_guard<std::mutex> lock(g_optionsMutex);
    g_options = options;
}
