#include "platform/transfer/S3Store.h"

#include <curl/curl.h>

#include <cctype>
#include <cstring>
#include <mutex>
#include <utility>
#include <vector>

#include "platform/logger/Logger.h"
#include "platform/transfer/Digest.h"
#include "platform/transfer/HttpText.h"
#include "platform/transfer/S3PutRequest.h"
#include "platform/transfer/S3Response.h"
#include "platform/transfer/S3Target.h"

// What one HTTP exchange gave.
struct S3Exchange {
    bool cancelled = false;  // Cancel ended it
    CURLMcode multiCode = CURLM_OK;
    CURLcode transferCode = CURLE_OK;
    std::string curlError;  // curl's text for a transferCode other than CURLE_OK
    S3Response response;    // status, headers and body of the answer
    uint32_t responseTimeMs = 0;
};

namespace {

const char kFile[] = "platform/transfer/S3Store";
const size_t kMaxBodyKept = 64 * 1024;  // error documents are a few hundred bytes
const char kPut[] = "S3Store::Put";     // the function name of every line about a PUT
const int kMaxWaitMs = 1000;  // upper bound of one curl_multi_poll; curl's timers cut it shorter

// A text from the answer (header or XML element), made printable for a log line.
std::string Printable(const std::string& value) {
    return httptext::FoldSpaces(value, true);
}

struct Body {
    const uint8_t* data = nullptr;
    size_t size = 0;
    size_t offset = 0;  // bytes handed to curl so far
};

size_t ReadBody(char* buffer, size_t size, size_t count, void* user) {
    auto* body = static_cast<Body*>(user);
    size_t n = std::min(size * count, body->size - body->offset);
    if (n > 0) std::memcpy(buffer, body->data + body->offset, n);
    body->offset += n;
    return n;
}

// curl rewinds when it must send the body again (a reused connection that was closed).
int SeekBody(void* user, curl_off_t offset, int origin) {
    auto* body = static_cast<Body*>(user);
    if (origin != SEEK_SET || offset < 0 || static_cast<size_t>(offset) > body->size) {
        return CURL_SEEKFUNC_CANTSEEK;
    }
    body->offset = static_cast<size_t>(offset);
    return CURL_SEEKFUNC_OK;
}

size_t KeepBody(char* data, size_t size, size_t count, void* user) {
    auto* response = static_cast<S3Response*>(user);
    size_t n = size * count;
    if (response->body.size() < kMaxBodyKept) {
        response->body.append(data, std::min(n, kMaxBodyKept - response->body.size()));
    }
    return n;
}

size_t KeepHeader(char* data, size_t size, size_t count, void* user) {
    auto* response = static_cast<S3Response*>(user);
    size_t n = size * count;
    std::string line(data, n);
    while (!line.empty() && (line.back() == '\r' || line.back() == '\n')) line.pop_back();
    if (line.compare(0, 5, "HTTP/") == 0) {
        // A new answer begins (the one after a 100 Continue): forget the earlier headers.
        *response = S3Response{};
        return n;
    }
    size_t colon = line.find(':');
    if (colon == std::string::npos) return n;
    std::string name = httptext::Lower(line.substr(0, colon));
    size_t start = line.find_first_not_of(" \t", colon + 1);
    std::string value = start == std::string::npos ? "" : line.substr(start);
    if (name == "etag") response->etag = value;
    if (name == "date") response->date = value;
    if (name == "x-amz-server-side-encryption") response->encryption = value;
    if (name == "x-amz-request-id") response->requestId = value;
    return n;
}

FileTransferResult ClassifyCurlError(CURLcode code) {
    switch (code) {
        case CURLE_OPERATION_TIMEDOUT:
            return TimeOut;
        case CURLE_COULDNT_RESOLVE_PROXY:
        case CURLE_COULDNT_RESOLVE_HOST:
        case CURLE_COULDNT_CONNECT:
        case CURLE_SEND_ERROR:
        case CURLE_RECV_ERROR:
        case CURLE_GOT_NOTHING:
        case CURLE_PARTIAL_FILE:
        case CURLE_SSL_CONNECT_ERROR:
        case CURLE_PEER_FAILED_VERIFICATION:
        case CURLE_SEND_FAIL_REWIND:
        case CURLE_HTTP2:
        case CURLE_HTTP2_STREAM:
        case CURLE_WEIRD_SERVER_REPLY:
            return NetworkError;
        default:
            return InternalError;
    }
}

// Failures that may pass by themselves: the connection could not be made or broke, or the
// server was too slow. Not a certificate that does not verify, nor a body curl cannot resend.
bool RetryableCurlError(CURLcode code) {
    switch (code) {
        case CURLE_OPERATION_TIMEDOUT:
        case CURLE_COULDNT_RESOLVE_PROXY:
        case CURLE_COULDNT_RESOLVE_HOST:
        case CURLE_COULDNT_CONNECT:
        case CURLE_SEND_ERROR:
        case CURLE_RECV_ERROR:
        case CURLE_GOT_NOTHING:
        case CURLE_PARTIAL_FILE:
        case CURLE_SSL_CONNECT_ERROR:
        case CURLE_HTTP2:
        case CURLE_HTTP2_STREAM:
            return true;
        default:
            return false;
    }
}

// "[v6]:port" into "[v6]" and "port" (empty when absent).
bool SplitIpv6Authority(const std::string& authority, std::string& host, std::string& port,
                        std::string& why) {
    why = "endpoint URL has a malformed IPv6 address";
    size_t close = authority.find(']');
    if (close == std::string::npos || close == 1) return false;
    host = authority.substr(0, close + 1);
    std::string after = authority.substr(close + 1);
    if (!after.empty() && after[0] != ':') return false;
    if (!after.empty()) port = after.substr(1);
    for (char c : host.substr(1, host.size() - 2)) {
        if (!std::isxdigit(static_cast<unsigned char>(c)) && c != ':' && c != '.') return false;
    }
    return true;
}

// "host[:port]" or "[v6][:port]" into the host (lower case) and the port text.
bool SplitAuthority(const std::string& authority, std::string& host, std::string& port,
                    std::string& why) {
    if (!authority.empty() && authority[0] == '[') {
        if (!SplitIpv6Authority(authority, host, port, why)) return false;
    } else {
        size_t colon = authority.find(':');
        host = httptext::Lower(authority.substr(0, colon));
        if (colon != std::string::npos) {
            port = authority.substr(colon + 1);
            if (port.empty()) {
                why = "endpoint URL has an empty port";
                return false;
            }
        }
        for (unsigned char c : host) {
            if (!std::isalnum(c) && c != '.' && c != '-' && c != '_') {
                why = "endpoint URL has an invalid host name";
                return false;
            }
        }
    }
    if (host.empty()) {
        why = "endpoint URL has no host";
        return false;
    }
    return true;
}

// A port text (empty: none) in its normal decimal form, 1 to 65535.
bool NormalPort(std::string& port, std::string& why) {
    if (port.empty()) return true;
    long value = 0;
    for (unsigned char c : port) {
        if (!std::isdigit(c) || value > 65535) break;
        value = value * 10 + (c - '0');
    }
    if (port.find_first_not_of("0123456789") != std::string::npos || value < 1 || value > 65535) {
        why = "endpoint URL has an invalid port";
        return false;
    }
    port = std::to_string(value);
    return true;
}

struct CurlSlist {
    curl_slist* list = nullptr;
    ~CurlSlist() { curl_slist_free_all(list); }
    bool Add(const std::string& line) {
        curl_slist* next = curl_slist_append(list, line.c_str());
        if (next == nullptr) return false;
        list = next;
        return true;
    }
};

// Options of one PUT: the URL, the body through ReadBody/SeekBody, the answer into `response`,
// the store's timeouts.
void SetUpEasy(CURL* easy, const std::string& url, const S3StoreConfig& config, curl_slist* headers,
               Body& body, S3Response& response, char* errorBuffer) {
    curl_easy_setopt(easy, CURLOPT_URL, url.c_str());
    curl_easy_setopt(easy, CURLOPT_PROTOCOLS_STR, "http,https");
    curl_easy_setopt(easy, CURLOPT_UPLOAD, 1L);
    curl_easy_setopt(easy, CURLOPT_INFILESIZE_LARGE, static_cast<curl_off_t>(body.size));
    curl_easy_setopt(easy, CURLOPT_READFUNCTION, ReadBody);
    curl_easy_setopt(easy, CURLOPT_READDATA, &body);
    curl_easy_setopt(easy, CURLOPT_SEEKFUNCTION, SeekBody);
    curl_easy_setopt(easy, CURLOPT_SEEKDATA, &body);
    curl_easy_setopt(easy, CURLOPT_HEADERFUNCTION, KeepHeader);
    curl_easy_setopt(easy, CURLOPT_HEADERDATA, &response);
    curl_easy_setopt(easy, CURLOPT_WRITEFUNCTION, KeepBody);
    curl_easy_setopt(easy, CURLOPT_WRITEDATA, &response);
    curl_easy_setopt(easy, CURLOPT_HTTPHEADER, headers);
    curl_easy_setopt(easy, CURLOPT_ERRORBUFFER, errorBuffer);
    curl_easy_setopt(easy, CURLOPT_NOSIGNAL, 1L);
    curl_easy_setopt(easy, CURLOPT_CONNECTTIMEOUT_MS, config.connectTimeoutMs);
    curl_easy_setopt(easy, CURLOPT_LOW_SPEED_LIMIT, config.lowSpeedLimit);
    curl_easy_setopt(easy, CURLOPT_LOW_SPEED_TIME, config.lowSpeedTimeS);
    if (!config.caBundle.empty()) curl_easy_setopt(easy, CURLOPT_CAINFO, config.caBundle.c_str());
    curl_easy_setopt(easy, CURLOPT_TCP_KEEPALIVE, 1L);
    // The key goes as signed: "." and ".." parts are part of the key, not steps in a path.
    curl_easy_setopt(easy, CURLOPT_PATH_AS_IS, 1L);
}

// Drives `easy` on `multi` until it is done, the multi interface fails, or `cancelled` is set;
// records which in `exchange`.
void RunToCompletion(CURLM* multi, CURL* easy, const CancelSignal& cancel, S3Exchange& exchange) {
    bool finished = false;
    exchange.multiCode = curl_multi_add_handle(multi, easy);
    while (exchange.multiCode == CURLM_OK && !finished) {
        if (cancel.Raised()) {
            exchange.cancelled = true;
            return;
        }
        int running = 0;
        exchange.multiCode = curl_multi_perform(multi, &running);
        int left = 0;
        while (CURLMsg* message = curl_multi_info_read(multi, &left)) {
            if (message->msg == CURLMSG_DONE && message->easy_handle == easy) {
                exchange.transferCode = message->data.result;
                finished = true;
            }
        }
        if (finished || exchange.multiCode != CURLM_OK) return;
        exchange.multiCode = curl_multi_poll(multi, nullptr, 0, kMaxWaitMs, nullptr);
    }
}

}  // namespace

bool S3StoreConfig::Parse(const std::string& endpointUrl, S3StoreConfig& out, std::string& why) {
    if (endpointUrl.empty()) {
        out.endpoint.clear();
        return true;
    }
    size_t schemeEnd = endpointUrl.find("://");
    std::string scheme = httptext::Lower(endpointUrl.substr(0, schemeEnd));
    if (schemeEnd == std::string::npos || (scheme != "http" && scheme != "https")) {
        why = "endpoint URL must start with http:// or https://";
        return false;
    }
    std::string rest = endpointUrl.substr(schemeEnd + 3);
    size_t authorityEnd = rest.find_first_of("/?#");
    std::string authority = rest.substr(0, authorityEnd);
    std::string tail = authorityEnd == std::string::npos ? "" : rest.substr(authorityEnd);
    if (!tail.empty() && tail != "/") {
        why = "endpoint URL must not have a path, query or fragment";
        return false;
    }
    if (authority.find('@') != std::string::npos) {
        why = "endpoint URL must not carry a user name";
        return false;
    }
    std::string host, port;
    if (!SplitAuthority(authority, host, port, why) || !NormalPort(port, why)) return false;
    out.endpoint = scheme + "://" + host + (port.empty() ? "" : ":" + port);
    return true;
}

S3Store::S3Store(S3StoreConfig config) : config_(std::move(config)), signer_(config_.clockOffset) {
    // Thread-safe in this libcurl, but done once: it is process-wide and never undone.
    static std::once_flag globalInit;
    std::call_once(globalInit, [] { curl_global_init(CURL_GLOBAL_DEFAULT); });
    multi_ = curl_multi_init();

    S3StoreConfig parsed;
    std::string why;
    endpointValid_ = S3StoreConfig::Parse(config_.endpoint, parsed, why);
    endpoint_ = parsed.endpoint;
    if (!endpointValid_) {
        Logger::Put(4, kFile, "S3Store::S3Store", __LINE__, "unusable endpoint: %s", why.c_str());
    }
}

S3Store::~S3Store() {
    if (multi_ != nullptr) curl_multi_cleanup(static_cast<CURLM*>(multi_));
}

void S3Store::Cancel() {
    cancel_.Raise();
    // Wakes a Put that waits in curl_multi_poll; a Put that is not waiting yet finds the
    // wake-up pending (or the flag set) before it waits.
    if (multi_ != nullptr) curl_multi_wakeup(static_cast<CURLM*>(multi_));
}

FileTransferResult S3Store::Put(const ObjectToStore& object, const StoreCredentials& credentials,
                                FileTransferInfo* info) {
    FileTransferInfo local;
    if (info == nullptr) info = &local;
    info->fileSize = 0;
    info->responseTime = 0;

    if (cancel_.Raised()) return TimeOut;
    S3Target target;
    const FileTransferResult refusal = checkSendable(object, credentials, target);
    if (refusal != Success) return refusal;
    const S3Payload payload = DigestS3Payload(object, target);
    const auto started = std::chrono::steady_clock::now();
    const FileTransferResult result = RunAttempts(
        config_.retry, cancel_, [&] { return attempt(target, object, credentials, payload); });
    info->responseTime =
        static_cast<uint32_t>(std::chrono::duration_cast<std::chrono::milliseconds>(
                                  std::chrono::steady_clock::now() - started)
                                  .count());
    if (result == Success) info->fileSize = object.size;
    return result;
}

AttemptOutcome S3Store::attempt(const S3Target& target, const ObjectToStore& object,
                                const StoreCredentials& credentials, const S3Payload& payload) {
    // Signed anew: the signature covers the time of sending.
    const S3PutRequest request =
        SignS3Put(target, object, credentials, payload, SigV4Signer::AmzDate(signer_.Now()),
                  config_.objectHeaders);
    S3Exchange exchange;
    if (!perform(target.url, request, object, exchange)) {
        Logger::Put(4, kFile, kPut, __LINE__, "PUT %s/%s not sent: out of memory",
                    object.bucket.c_str(), object.key.c_str());
        return {InternalError, false};
    }
    const std::vector<std::string> secrets = {credentials.secretKey, credentials.sessionToken,
                                              request.signature};
    return interpret(exchange, object, payload.md5Hex, secrets);
}

FileTransferResult S3Store::checkSendable(const ObjectToStore& object,
                                          const StoreCredentials& credentials, S3Target& target) {
    if (credentials.accessKey.empty() || credentials.secretKey.empty()) {
        Logger::Put(5, kFile, kPut, __LINE__, "PUT %s/%s not sent: no credentials",
                    object.bucket.c_str(), object.key.c_str());
        return AuthenticationError;
    }
    if (!endpointValid_ || multi_ == nullptr) {
        Logger::Put(4, kFile, kPut, __LINE__, "PUT %s/%s not sent: store not usable",
                    object.bucket.c_str(), object.key.c_str());
        return InternalError;
    }
    // The region and the keys come with the credentials, and new ones may be usable: what is
    // wrong with them is an AuthenticationError, which makes the recorder ask for new ones.
    std::string why;
    if (!ValidateCredentialText(credentials, why) ||
        (!credentials.region.empty() &&
         !ValidateRegion(credentials.region, endpoint_.empty(), why))) {
        Logger::Put(5, kFile, kPut, __LINE__, "PUT \"%s/%s\" not sent: %s", object.bucket.c_str(),
                    object.key.c_str(), why.c_str());
        return AuthenticationError;
    }
    if (!S3TargetFor(endpoint_, object.bucket, object.key, credentials, target, why,
                     config_.addressing)) {
        Logger::Put(5, kFile, kPut, __LINE__, "PUT \"%s/%s\" not sent: %s", object.bucket.c_str(),
                    object.key.c_str(), why.c_str());
        return FilePathError;
    }
    return Success;
}

bool S3Store::perform(const std::string& url, const S3PutRequest& request,
                      const ObjectToStore& object, S3Exchange& exchange) {
    CurlSlist headers;
    bool headersOk = headers.Add("Expect:");  // no 100-continue round trip
    for (const auto& [name, value] : request.headers) {
        // curl drops a header written "name:" with nothing after it, but sends "name;" as an
        // empty one; the signature covers it either way.
        headersOk &= headers.Add(value.empty() ? name + ";" : name + ": " + value);
    }
    headersOk &= headers.Add("Authorization: " + request.authorization);
    CURL* easy = curl_easy_init();
    if (easy == nullptr || !headersOk) {
        if (easy != nullptr) curl_easy_cleanup(easy);
        return false;
    }
    Body body{object.data, object.size, 0};
    char curlError[CURL_ERROR_SIZE] = {};
    SetUpEasy(easy, url, config_, headers.list, body, exchange.response, curlError);

    // curl_multi_poll sleeps until the socket, a curl timer (connect and low-speed timeouts) or
    // Cancel's curl_multi_wakeup needs attention.
    CURLM* multi = static_cast<CURLM*>(multi_);
    const auto started = std::chrono::steady_clock::now();
    RunToCompletion(multi, easy, cancel_, exchange);
    exchange.responseTimeMs =
        static_cast<uint32_t>(std::chrono::duration_cast<std::chrono::milliseconds>(
                                  std::chrono::steady_clock::now() - started)
                                  .count());
    curl_multi_remove_handle(multi, easy);
    curl_easy_getinfo(easy, CURLINFO_RESPONSE_CODE, &exchange.response.status);
    curl_easy_cleanup(easy);
    if (exchange.transferCode != CURLE_OK)
        exchange.curlError =
            curlError[0] != '\0' ? curlError : curl_easy_strerror(exchange.transferCode);
    return true;
}

AttemptOutcome S3Store::interpret(const S3Exchange& exchange, const ObjectToStore& object,
                                  const std::string& md5Hex,
                                  const std::vector<std::string>& secrets) {
    const std::string where = object.bucket + "/" + object.key;
    if (exchange.cancelled) {
        Logger::Put(5, kFile, kPut, __LINE__, "PUT %s cancelled after %u ms", where.c_str(),
                    exchange.responseTimeMs);
        return {TimeOut, false};
    }
    if (exchange.multiCode != CURLM_OK) {
        Logger::Put(4, kFile, kPut, __LINE__, "PUT %s: curl multi error %d", where.c_str(),
                    static_cast<int>(exchange.multiCode));
        return {InternalError, false};
    }
    if (exchange.transferCode != CURLE_OK) {
        FileTransferResult result = ClassifyCurlError(exchange.transferCode);
        Logger::Put(5, kFile, kPut, __LINE__, "PUT %s failed after %u ms: %s (curl %d) -> %x",
                    where.c_str(), exchange.responseTimeMs,
                    httptext::Redact(exchange.curlError, secrets).c_str(),
                    static_cast<int>(exchange.transferCode), static_cast<unsigned>(result));
        return {result, RetryableCurlError(exchange.transferCode)};
    }
    const S3Response& response = exchange.response;
    const std::string code = response.XmlElement("Code");
    FileTransferResult result = ClassifyS3Answer(response.status, code);
    if (result == Success) return {checkStored(exchange, where, object.size, md5Hex), false};

    std::string message = httptext::Redact(Printable(response.XmlElement("Message")), secrets);
    std::string requestId = Printable(response.requestId);
    if (!requestId.empty()) requestId = " request id " + requestId;
    Logger::Put(5, kFile, kPut, __LINE__, "PUT %s: HTTP %ld %s \"%s\"%s -> %x", where.c_str(),
                response.status, Printable(code).c_str(), message.c_str(), requestId.c_str(),
                static_cast<unsigned>(result));
    if (result == RequestTimeTooSkewed) correctClock(response);
    return {result, RetryableS3Answer(response.status, code)};
}

FileTransferResult S3Store::checkStored(const S3Exchange& exchange, const std::string& where,
                                        size_t size, const std::string& md5Hex) {
    const S3Response& response = exchange.response;
    // With SSE-KMS the ETag is not the MD5 of the body; S3 has checked Content-MD5 then.
    bool kms = response.encryption.compare(0, 7, "aws:kms") == 0;
    if (!kms && !EtagMatches(response.etag, md5Hex)) {
        Logger::Put(5, kFile, kPut, __LINE__, "PUT %s: ETag %s is not the body's MD5 %s",
                    where.c_str(), Printable(response.etag).c_str(), md5Hex.c_str());
        return FileBroken;
    }
    Logger::Put(13, kFile, kPut, __LINE__, "PUT %s: %zu bytes stored in %u ms", where.c_str(), size,
                exchange.responseTimeMs);
    return Success;
}

void S3Store::correctClock(const S3Response& response) {
    std::chrono::system_clock::time_point serverTime;
    if (ParseServerTime(response.date, serverTime) ||
        ParseServerTime(response.XmlElement("ServerTime"), serverTime)) {
        signer_.CorrectClock(serverTime);
        Logger::Put(5, kFile, kPut, __LINE__,
                    "signing clock set to the server's time (offset %lld s)",
                    static_cast<long long>(signer_.ClockOffset().count()));
    } else {
        Logger::Put(5, kFile, kPut, __LINE__, "server time unknown; clock not corrected");
    }
}
