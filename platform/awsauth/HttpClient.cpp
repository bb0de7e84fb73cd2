#include "platform/awsauth/HttpClient.h"

#include <curl/curl.h>

#include <algorithm>
#include <cctype>
#include <mutex>

namespace awsauth {

namespace {

const size_t kMaxBody = 1024 * 1024;

size_t KeepBody(char* data, size_t size, size_t count, void* user) {
    auto* response = static_cast<HttpResponse*>(user);
    size_t n = size * count;
    if (response->body.size() < kMaxBody) {
        response->body.append(data, std::min(n, kMaxBody - response->body.size()));
    }
    return n;
}

size_t KeepHeader(char* data, size_t size, size_t count, void* user) {
    auto* response = static_cast<HttpResponse*>(user);
    size_t n = size * count;
    std::string line(data, n);
    while (!line.empty() && (line.back() == '\r' || line.back() == '\n')) line.pop_back();
    size_t colon = line.find(':');
    if (line.compare(0, 5, "HTTP/") == 0) {
        response->headers.clear();  // an answer after a 1xx: forget the earlier headers
    } else if (colon != std::string::npos) {
        std::string name = line.substr(0, colon);
        for (char& c : name) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
        size_t start = line.find_first_not_of(" \t", colon + 1);
        response->headers[name] = start == std::string::npos ? "" : line.substr(start);
    }
    return n;
}

}  // namespace

bool Send(const HttpRequest& request, HttpResponse& response, std::string& why) {
    // Process-wide and never undone; the S3 store does the same.
    static std::once_flag globalInit;
    std::call_once(globalInit, [] { curl_global_init(CURL_GLOBAL_DEFAULT); });
    response = HttpResponse{};
    CURL* easy = curl_easy_init();
    if (easy == nullptr) {
        why = "out of memory";
        return false;
    }
    curl_slist* headers = curl_slist_append(nullptr, "Expect:");
    for (const auto& [name, value] : request.headers) {
        headers =
            curl_slist_append(headers, (value.empty() ? name + ";" : name + ": " + value).c_str());
    }
    char error[CURL_ERROR_SIZE] = {};
    curl_easy_setopt(easy, CURLOPT_URL, request.url.c_str());
    curl_easy_setopt(easy, CURLOPT_PROTOCOLS_STR, "http,https");
    curl_easy_setopt(easy, CURLOPT_CUSTOMREQUEST, request.method.c_str());
    if (request.method == "POST" || request.method == "PUT" || !request.body.empty()) {
        curl_easy_setopt(easy, CURLOPT_POSTFIELDS, request.body.c_str());
        curl_easy_setopt(easy, CURLOPT_POSTFIELDSIZE_LARGE,
                         static_cast<curl_off_t>(request.body.size()));
    }
    curl_easy_setopt(easy, CURLOPT_HTTPHEADER, headers);
    curl_easy_setopt(easy, CURLOPT_HEADERFUNCTION, KeepHeader);
    curl_easy_setopt(easy, CURLOPT_HEADERDATA, &response);
    curl_easy_setopt(easy, CURLOPT_WRITEFUNCTION, KeepBody);
    curl_easy_setopt(easy, CURLOPT_WRITEDATA, &response);
    curl_easy_setopt(easy, CURLOPT_ERRORBUFFER, error);
    curl_easy_setopt(easy, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(easy, CURLOPT_CONNECTTIMEOUT_MS, request.connectTimeoutMs);
    curl_easy_setopt(easy, CURLOPT_TIMEOUT_MS, request.totalTimeoutMs);
    curl_easy_setopt(easy, CURLOPT_NOPROXY, "169.254.169.254,169.254.170.2,127.0.0.1,localhost");
    if (!request.caBundle.empty()) curl_easy_setopt(easy, CURLOPT_CAINFO, request.caBundle.c_str());
    CURLcode code = curl_easy_perform(easy);
    curl_easy_getinfo(easy, CURLINFO_RESPONSE_CODE, &response.status);
    curl_easy_cleanup(easy);
    curl_slist_free_all(headers);
    if (code != CURLE_OK) {
        why = error[0] != '\0' ? error : curl_easy_strerror(code);
        response.status = 0;
        return false;
    }
    return true;
}

}  // namespace awsauth
