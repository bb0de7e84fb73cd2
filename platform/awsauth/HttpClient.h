// HttpClient: one blocking HTTP(S) exchange over libcurl, for the small requests of the
// credential sources (STS, the container endpoint, the instance metadata service).
//
// Send is a pure function of its arguments: it may run on several threads at once, each call
// with its own connection. It reads the whole answer (bodies are kept up to 1 MiB) and never
// follows redirects. Header values are sent as given: callers pass no line breaks. Nothing is
// logged here; the caller decides what of a failure reaches the log.
#pragma once

#include <map>
#include <string>
#include <utility>
#include <vector>

namespace awsauth {

struct HttpRequest {
    std::string method = "GET";
    std::string url;
    std::vector<std::pair<std::string, std::string>> headers;
    std::string body;
    long connectTimeoutMs = 5000;  // TCP (and TLS) set-up
    long totalTimeoutMs = 15000;   // the whole exchange
    std::string caBundle;          // PEM file of the CAs to trust; "" for the system's
};

struct HttpResponse {
    long status = 0;  // HTTP status; 0 when no answer came
    std::string body;
    std::map<std::string, std::string> headers;  // names in lower case
};

// True when an answer came (any status); false with a reason (curl's text) when the exchange
// failed: refused, not resolved, timed out, TLS, ...
bool Send(const HttpRequest& request, HttpResponse& response, std::string& why);

}  // namespace awsauth
