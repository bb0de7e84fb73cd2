#include "platform/framework/FrameworkOptions.h"

#include <cctype>
#include <cerrno>
#include <climits>
#include <cmath>
#include <cstdlib>
#include <mutex>

CommandLine::CommandLine(int argc, char** argv) {
    for (int i = 0; i < argc; ++i) args_.emplace_back(argv[i] ? argv[i] : "");
}

bool CommandLine::Find(const std::string& name, std::string& value) const {
    const std::string flag = "-" + name;
    bool found = false;
    for (size_t i = 1; i + 1 < args_.size(); ++i) {
        if (args_[i] == flag) {
            value = args_[i + 1];
            found = true;
            ++i;
        }
    }
    return found;
}

bool CommandLine::ParseInt(const std::string& text, int& value) {
    if (text.empty() || text.size() > 64) return false;
    if (!std::isdigit(static_cast<unsigned char>(text[0])) && text[0] != '-' && text[0] != '+')
        return false;  // strtoll would skip leading blanks
    errno = 0;
    char* end = nullptr;
    long long parsed = std::strtoll(text.c_str(), &end, 10);
    if (errno != 0 || end == text.c_str() || *end != '\0') return false;
    if (parsed < INT_MIN || parsed > INT_MAX) return false;
    value = static_cast<int>(parsed);
    return true;
}

bool CommandLine::ParseDouble(const std::string& text, double& value) {
    if (text.empty() || text.size() > 64) return false;
    errno = 0;
    char* end = nullptr;
    double parsed = std::strtod(text.c_str(), &end);
    if (errno != 0 || end == text.c_str() || *end != '\0' || !std::isfinite(parsed)) return false;
    value = parsed;
    return true;
}

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
    cl.Find("region", o.region);
    cl.Find("credentialprocess", o.credentialProcess);
    cl.Find("segmentformat", o.segmentFormat);
    if (o.segmentFormat != "ts") {
        errors.push_back("-segmentformat: only \"ts\" is supported, got \"" + o.segmentFormat +
                         "\"");
    }
    cl.Find("keyprefix", o.keyPrefix);
    if (cl.Find("loglevel", v) && !CommandLine::ParseInt(v, o.logLevel)) {
        errors.push_back("-loglevel needs a whole number, got \"" + v + "\"");
        o.logLevel = 11;
    }
    cl.Find("logfile", o.logFile);
    cl.Find("status", o.statusPath);
    o.upload = UploadOptions::Read(cl, errors);
    return o;
}

const FrameworkOptions& CurrentFrameworkOptions() {
    std::lock_guard<std::mutex> lock(g_optionsMutex);
    return g_options;
}

void SetCurrentFrameworkOptions(const FrameworkOptions& options) {
    std::lock_guard<std::mutex> lock(g_optionsMutex);
    g_options = options;
}
