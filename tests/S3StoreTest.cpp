// S3Store against s3rver on 127.0.0.1 (read back with awscli) and against scripted TCP peers
// for the answers and failures s3rver cannot give. Faults guarded: an object not stored byte for
// byte with its metadata and upload options; a key normalised or encoded unlike its signature;
// a wrong or skewed signature not corrected from the refusal; credentials in the log or a header
// smuggled in through a value; an ETag or MD5 mismatch taken for success; an answer mapped to the
// wrong result or retried when it must not be (or not when it may); a stalled or reset peer not
// ending the attempt; Cancel not ending an exchange or a retry wait promptly; endpoints, bucket
// names and addressing (virtual, path, accelerate, China, dotted buckets) unlike AWS clients.
#include <gtest/gtest.h>
#include <unistd.h>

#include <atomic>
#include <random>
#include <thread>

#include "platform/transfer/Digest.h"
#include "platform/transfer/S3PutRequest.h"
#include "platform/transfer/S3Response.h"
#include "platform/transfer/S3Store.h"
#include "platform/transfer/S3Target.h"
#include "tests/support/LogCapture.h"
#include "tests/support/S3rver.h"
#include "tests/support/ScriptedHttpServer.h"
#include "tests/support/TestSupport.h"

using namespace std::chrono;
using namespace testsupport;
using Server = ScriptedHttpServer;

namespace {

std::string RandomBytes(size_t size, unsigned seed) {
    std::mt19937 random(seed);
    std::string out(size, '\0');
    for (char& c : out) c = static_cast<char>(random());
    return out;
}

ObjectToStore Object(const std::string& key, const std::string& body,
                     const std::string& bucket = S3rver::kBucket) {
    ObjectToStore object = ObjectFor(bucket, key, body);
    object.contentType = "video/mp2t";
    object.metadata = {{"streamingid", "cam 1"}, {"sequencenumber", "7"}, {"duration", "10000"}};
    return object;
}

StoreCredentials Credentials(const std::string& secret = S3rver::kSecretKey) {
    return {S3rver::kAccessKey, secret, "tok-EN/with+chars==", "us-east-1", false};
}

// What the upload options make of -sse aws:kms -ssekmskeyid alias/rec -storageclass STANDARD_IA
// -acl bucket-owner-full-control -tagging "site=north 1&cam=1".
const std::vector<std::pair<std::string, std::string>> kUploadHeaders = {
    {"x-amz-server-side-encryption", "aws:kms"},
    {"x-amz-server-side-encryption-aws-kms-key-id", "alias/rec"},
    {"x-amz-storage-class", "STANDARD_IA"},
    {"x-amz-acl", "bucket-owner-full-control"},
    {"x-amz-tagging", "site=north%201&cam=1"}};

// Retries within a Put wait at most 1 ms here: these tests count attempts, not waits.
S3StoreConfig Config(const std::string& endpoint) {
    S3StoreConfig config;
    std::string why;
    EXPECT_TRUE(S3StoreConfig::Parse(endpoint, config, why)) << why;
    config.retry.retryBase = config.retry.retryCap = milliseconds(1);
    return config;
}

}  // namespace

// Against s3rver: a clock 20 minutes ahead corrected from the refusal; keys that need encoding
// and "." / ".." parts, metadata signed as sent; refusals; the server gone. Nothing of the
// credentials reaches the log. (Upload options against s3rver: EndToEndTest's static key run.)
TEST(S3StoreS3rverTest, StoresByteIdenticalCorrectsSkewRefusesAndLogsNoCredentials) {
    S3rver server;
    ASSERT_TRUE(server.Start(SFR_SOURCE_DIR "/scripts/s3rver.sh", BuildPath("node")))
        << server.Error();
    // What awscli's head-object tells of a key (its ETag is the MD5 of the bytes stored).
    auto head = [&](const std::string& key) {
        std::vector<std::string> argv =
            Words(std::string("env AWS_ACCESS_KEY_ID=") + S3rver::kAccessKey +
                  " AWS_SECRET_ACCESS_KEY=" + S3rver::kSecretKey +
                  " AWS_DEFAULT_REGION=us-east-1 /usr/bin/aws --endpoint-url " + server.Endpoint() +
                  " s3api head-object --bucket rec --key");
        argv.push_back(key);
        return RunProcess(argv, 120000);
    };
    LogCapture capture;
    S3StoreConfig skewed = Config(server.Endpoint());
    skewed.clockOffset = minutes(20);
    S3Store store(skewed);
    const std::string key = "pre fix/cam:1/2026/01/02/cam=1_20260102T030405.678Z_1 (a+b)!.ts";
    const std::string body = RandomBytes(300 * 1024 + 17, 1), body2 = RandomBytes(1000, 2);
    FileTransferInfo info;
    EXPECT_EQ(store.Put(Object(key, body), Credentials(), &info), RequestTimeTooSkewed);
    EXPECT_LE(std::abs(store.ClockOffset().count()), 2);
    ASSERT_EQ(store.Put(Object(key, body), Credentials(), &info), Success);
    EXPECT_EQ(info.fileSize, body.size());
    // Over the reused connection; were the path normalised, the signature would fail.
    ObjectToStore second = Object("cam1/../x/./second.ts", body2);
    second.metadata["empty"] = "";  // signed and sent as an empty header
    ASSERT_EQ(store.Put(second, Credentials(), &info), Success);
    const auto first = head(key);
    ASSERT_EQ(first.exitStatus, 0) << first.output;
    for (const std::string& expected :
         {std::string("\"ContentType\": \"video/mp2t\""), std::string("\"streamingid\": \"cam 1\""),
          std::string("\"sequencenumber\": \"7\""), std::string("\"duration\": \"10000\""),
          "\"ETag\": \"\\\"" + digest::Hex(digest::Md5Of(body.data(), body.size())),
          "\"ContentLength\": " + std::to_string(body.size())})
        EXPECT_NE(first.output.find(expected), std::string::npos) << expected << first.output;

    const StoreCredentials wrong = Credentials("wrong-secret-value");
    EXPECT_EQ(store.Put(Object("k.ts", body2), wrong, &info), AuthenticationError);
    EXPECT_EQ(info.fileSize, 0u);
    EXPECT_EQ(store.Put(Object("k.ts", body2, "no-such-bucket"), Credentials(), &info),
              FilePathError);
    server.Stop();
    EXPECT_EQ(store.Put(Object("k.ts", body2), Credentials(), &info), NetworkError);
    ASSERT_FALSE(capture.Records().empty());
    for (const std::string& secret :
         {std::string(S3rver::kSecretKey), wrong.secretKey, wrong.sessionToken,
          std::string("Signature="), std::string("Credential="), std::string("AWS4-HMAC"),
          std::string(S3rver::kAccessKey)})
        EXPECT_EQ(capture.CountContaining(secret), 0u) << secret;
}

// What the request carries, as a scripted server receives it; how scripted answers map, and
// which of them are tried again within the Put.
TEST(S3StoreScriptedTest, RequestHeadersAndAnswers) {
    const std::string body = RandomBytes(70000, 4);
    const std::string md5Hex = digest::Hex(digest::Md5Of(body.data(), body.size()));
    Server ok(Server::Mode::kRespond, HttpAnswer("200 OK", "ETag: \"" + md5Hex + "\"\r\n"));
    S3StoreConfig config = Config(ok.Endpoint());
    config.objectHeaders = kUploadHeaders;
    S3Store store(config);
    FileTransferInfo info;
    ASSERT_EQ(store.Put(Object("a b/../c/./d.ts", body), Credentials(), &info), Success);
    EXPECT_EQ(info.fileSize, body.size());
    const std::string request = ok.Requests().back().raw;
    const std::string head = request.substr(0, request.find("\r\n\r\n") + 4);
    EXPECT_EQ(head.rfind("PUT /rec/a%20b/../c/./d.ts HTTP/1.1\r\n", 0), 0u) << head;
    for (const std::string& header :
         {"content-md5: " + digest::Base64(digest::Md5Of(body.data(), body.size())) + "\r\n",
          "x-amz-content-sha256: " + digest::Hex(digest::Sha256Of(body.data(), body.size())),
          std::string("content-type: video/mp2t\r\n"),
          std::string("x-amz-security-token: tok-EN/with+chars==\r\n"),
          std::string("x-amz-meta-streamingid: cam 1\r\n"),
          "Host: 127.0.0.1:" + std::to_string(ok.Port()) + "\r\n"})
        EXPECT_NE(head.find(header), std::string::npos) << header << head;
    for (const auto& [name, value] : kUploadHeaders)
        EXPECT_EQ(ok.Requests().back().Header(name), value) << name;
    EXPECT_EQ(head.find("Expect:"), std::string::npos);
    EXPECT_TRUE(request.substr(head.size()) == body);

    // A header value cannot smuggle in a header of its own.
    ObjectToStore sneaky = Object("s.ts", body);
    sneaky.metadata["note"] = "x\r\nx-amz-grant-read: uri=everyone";
    ASSERT_EQ(store.Put(sneaky, Credentials(), &info), Success);
    const std::string smuggled = ok.Requests().back().raw;
    EXPECT_EQ(smuggled.find("\r\nx-amz-grant-read"), std::string::npos);
    EXPECT_NE(smuggled.find("\r\nx-amz-meta-note: x__x-amz-grant-read: uri=everyone\r\n"),
              std::string::npos);

    std::string upperMd5 = md5Hex;
    for (char& c : upperMd5) c = static_cast<char>(toupper(c));
    const struct {
        std::string answer;
        FileTransferResult result;
        int attempts;  // requests within the one Put
    } cases[] = {
        {HttpAnswer("200 OK", "ETag: \"" + upperMd5 + "\"\r\n"), Success, 1},
        {HttpAnswer("200 OK", "ETag: \"" + md5Hex + "-2\"\r\n"), FileBroken, 1},  // multipart
        {HttpAnswer("200 OK", "ETag: \"00000000000000000000000000000000\"\r\n"), FileBroken, 1},
        {HttpAnswer("200 OK", ""), FileBroken, 1},
        {S3ErrorAnswer("500 Internal Server Error", "InternalError"), InternalError, 3},
        {S3ErrorAnswer("503 Slow Down", "SlowDown"), InternalError, 3},
        {S3ErrorAnswer("400 Bad Request", "RequestTimeout"), InternalError, 3},
        {S3ErrorAnswer("400 Bad Request", "InvalidArgument"), InternalError, 1},
        {S3ErrorAnswer("400 Bad Request", "BadDigest"), FileBroken, 1},
        {S3ErrorAnswer("400 Bad Request", "XAmzContentSHA256Mismatch"), FileBroken, 1},
        {S3ErrorAnswer("400 Bad Request", "ExpiredToken"), AuthenticationError, 1},
        {S3ErrorAnswer("403 Forbidden", "TokenRefreshRequired"), AuthenticationError, 1},
        {S3ErrorAnswer("403 Forbidden", "RequestTimeTooSkewed"), RequestTimeTooSkewed, 1},
        {S3ErrorAnswer("403 Forbidden", "SomethingNew"), AuthenticationError, 1},
        {S3ErrorAnswer("404 Not Found", "NoSuchBucket"), FilePathError, 1},
        {S3ErrorAnswer("301 Moved Permanently", "PermanentRedirect"), FilePathError, 1},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.answer);
        Server server(Server::Mode::kRespond, c.answer);
        EXPECT_EQ(
            S3Store(Config(server.Endpoint())).Put(Object("k.ts", body), Credentials(), &info),
            c.result);
        EXPECT_EQ(info.fileSize, c.result == Success ? body.size() : 0u);
        EXPECT_EQ(server.Connections(), c.attempts);
    }
}

TEST(S3StoreScriptedTest, BrokenConnectionsAndUnsendableCredentials) {
    FileTransferInfo info;
    const std::string body = RandomBytes(100000, 5);
    Server reset(Server::Mode::kReset);
    EXPECT_EQ(S3Store(Config(reset.Endpoint())).Put(Object("k.ts", body), Credentials(), &info),
              NetworkError);
    EXPECT_EQ(reset.Connections(), 3);
    EXPECT_EQ(S3Store(Config("http://no-such-host.invalid:9"))
                  .Put(Object("k.ts", body), Credentials(), &info),
              NetworkError);

    // Nothing is sent without credentials, nor with a line break where it would reach a header.
    Server idle(Server::Mode::kStall);
    S3Store idleStore(Config(idle.Endpoint()));
    StoreCredentials noSecret = Credentials(), region = Credentials(), key = Credentials(),
                     token = Credentials();
    noSecret.secretKey.clear();
    region.region = "us-east-1\r\nx-amz-acl: public-read";
    key.accessKey = "AKID\r\nx";
    token.sessionToken = "tok\nen";
    for (const StoreCredentials& unusable : {noSecret, StoreCredentials{}, region, key, token})
        EXPECT_EQ(idleStore.Put(Object("k.ts", body), unusable, &info), AuthenticationError);
    EXPECT_EQ(idle.Connections(), 0);

    // A stalled server: the low-speed limit (1 s here) ends each attempt.
    S3StoreConfig config = Config(idle.Endpoint());
    config.lowSpeedTimeS = 1;
    config.retry.attempts = 2;
    auto started = steady_clock::now();
    EXPECT_EQ(S3Store(config).Put(Object("k.ts", body.substr(0, 200)), Credentials(), &info),
              TimeOut);
    EXPECT_LT(steady_clock::now() - started, seconds(30));
    EXPECT_GE(info.responseTime, 900u);
    EXPECT_EQ(idle.Connections(), 2);
}

// Cancel comes from another thread while Put waits for an answer that never comes, or waits
// (a minute here) before trying again after a 503.
TEST(S3StoreConcurrencyTest, CancelEndsAnExchangeOrAWaitAndEveryLaterPut) {
    for (const std::string& answer : {std::string(), S3ErrorAnswer("503 Slow Down", "SlowDown")}) {
        Server server(answer.empty() ? Server::Mode::kStall : Server::Mode::kRespond, answer);
        S3StoreConfig config = Config(server.Endpoint());  // the 30 s low-speed limit stays
        config.retry.retryBase = config.retry.retryCap = minutes(1);
        config.retry.jitter = false;
        S3Store store(config);
        const std::string body = RandomBytes(10000, 7);
        std::atomic<int> result{-1};
        std::atomic<int64_t> endedNs{0};
        std::thread upload([&] {
            FileTransferInfo info;
            result = static_cast<int>(store.Put(Object("k.ts", body), Credentials(), &info));
            endedNs = steady_clock::now().time_since_epoch().count();
        });
        ASSERT_TRUE(WaitUntil([&] { return server.Connections() == 1; }));
        auto cancelled = steady_clock::now();
        store.Cancel();
        upload.join();
        EXPECT_EQ(result.load(), static_cast<int>(TimeOut));
        EXPECT_LT(steady_clock::time_point(steady_clock::duration(endedNs.load())) - cancelled,
                  seconds(5));

        FileTransferInfo info;
        EXPECT_EQ(store.Put(Object("k.ts", body), Credentials(), &info), TimeOut);
        EXPECT_EQ(server.Connections(), 1);
    }
}

TEST(S3StoreConfigTest, ParsesEndpointsAndServerTimes) {
    const std::pair<std::string, std::string> cases[] = {
        // url, normal form ("" when rejected)
        {"http://127.0.0.1:9000", "http://127.0.0.1:9000"},
        {"HTTPS://S3.Example.com/", "https://s3.example.com"},
        {"http://[::1]:8080", "http://[::1]:8080"},
        {"https://host:0443", "https://host:443"},
        {"", ""},  // AWS itself: accepted, no endpoint
        {"ftp://host", ""},
        {"host:9000", ""},
        {"http://", ""},
        {"http://host:", ""},
        {"http://host:70000", ""},
        {"http://host/path", ""},
        {"http://host?x=1", ""},
        {"http://user:pw@host", ""},
        {"http://ho st", ""},
        {"http://[::1", ""},
    };
    for (const auto& [url, normal] : cases) {
        S3StoreConfig config;
        std::string why;
        const bool ok = S3StoreConfig::Parse(url, config, why);
        EXPECT_EQ(ok, url.empty() || !normal.empty()) << url;
        EXPECT_EQ(ok ? config.endpoint : "", normal) << url;
        EXPECT_TRUE(ok || !why.empty()) << url;
    }
    for (const auto& [text, when] :
         {std::pair<std::string, time_t>{"Fri, 24 May 2013 00:00:00 GMT", 1369353600},
          {"2013-05-24T00:00:01Z", 1369353601},
          {"Fri, 24 Foo 2013 00:00:00 GMT", 0}}) {
        system_clock::time_point t;
        EXPECT_EQ(ParseServerTime(text, t) ? system_clock::to_time_t(t) : 0, when) << text;
    }
}

TEST(S3StoreConfigTest, AddressesObjectsAsAwsClientsDo) {
    const struct {
        const char* endpoint;
        const char* bucket;
        const char* key;
        const char* region;
        bool accelerate;
        const char* url;  // "" when the object cannot be addressed
        S3Addressing addressing = S3Addressing::kAuto;
    } cases[] = {
        {"", "my-bucket", "cam 1/a+b.ts", "eu-west-1", false,
         "https://my-bucket.s3.eu-west-1.amazonaws.com/cam%201/a%2Bb.ts"},
        {"", "my-bucket", "k.ts", "eu-west-1", true,
         "https://my-bucket.s3-accelerate.amazonaws.com/k.ts"},
        {"", "my-bucket", "k.ts", "", false, "https://my-bucket.s3.amazonaws.com/k.ts"},
        {"", "my.bucket", "k.ts", "eu-west-1", true,
         "https://s3.eu-west-1.amazonaws.com/my.bucket/k.ts"},
        {"", "rec", "k.ts", "cn-north-1", false, "https://rec.s3.cn-north-1.amazonaws.com.cn/k.ts"},
        {"", "rec", "a/../b.ts", "", false, "https://rec.s3.amazonaws.com/a/../b.ts"},
        // Acceleration is an AWS service: a custom endpoint stays path-style.
        {"http://127.0.0.1:9000", "rec", "a/b c.ts", "eu-west-1", true,
         "http://127.0.0.1:9000/rec/a/b%20c.ts"},
        {"http://127.0.0.1:9000", "Any_Name", "k", "garage", false,
         "http://127.0.0.1:9000/Any_Name/k"},
        {"", "Bad_Bucket", "k", "", false, ""},
        {"", "rec", "", "", false, ""},
        {"", "rec", "k", "eu-west-1.evil.example/", false, ""},
        {"http://127.0.0.1:9000", "rec", "k", "us-east-1\r\nx: y", false, ""},
        // -addressing asks for one style.
        {"", "my.bucket", "k.ts", "eu-west-1", false,
         "https://my.bucket.s3.eu-west-1.amazonaws.com/k.ts", S3Addressing::kVirtual},
        {"", "rec", "k.ts", "eu-west-1", true, "https://s3.eu-west-1.amazonaws.com/rec/k.ts",
         S3Addressing::kPath},
        {"https://minio.example:9000", "rec", "k.ts", "us-east-1", false,
         "https://rec.minio.example:9000/k.ts", S3Addressing::kVirtual},
        {"http://127.0.0.1:9000", "rec", "k.ts", "us-east-1", false, "", S3Addressing::kVirtual},
        {"http://[::1]:9000", "rec", "k.ts", "us-east-1", false, "", S3Addressing::kVirtual},
        {"https://minio.example", "Any_Name", "k", "us-east-1", false, "", S3Addressing::kVirtual},
    };
    for (const auto& c : cases) {
        S3Target t;
        std::string why;
        const StoreCredentials routing{"ak", "sk", "", c.region, c.accelerate};
        EXPECT_EQ(
            S3TargetFor(c.endpoint, c.bucket, c.key, routing, t, why, c.addressing) ? t.url : "",
            c.url)
            << c.bucket << " " << c.region << " " << why;
        if (!*c.url) continue;
        EXPECT_EQ(t.url.substr(t.url.find("://") + 3), t.host + t.canonicalUri);
        EXPECT_EQ(t.signingRegion, *c.region ? c.region : "us-east-1");
        // Over TLS the signature covers no body hash, so the body is hashed once (MD5).
        const bool tls = t.url.rfind("https://", 0) == 0;
        EXPECT_EQ(DigestS3Payload(Object(c.key, "abc"), t).sha256Hex == "UNSIGNED-PAYLOAD", tls);
    }

    for (const std::string& usable : {std::string("rec"), std::string("my.bucket-2"),
                                      std::string("a1b"), std::string(63, 'x')}) {
        std::string why;
        EXPECT_TRUE(ValidateBucketName(usable, why)) << usable << why;
    }
    for (const std::string& refused :
         {std::string("ab"), std::string("Rec"), std::string("my_bucket"), std::string("-rec"),
          std::string("rec."), std::string("a..b"), std::string("a-.b"), std::string("192.168.1.2"),
          std::string("xn--rec"), std::string("rec-s3alias"), std::string(64, 'x')}) {
        std::string why;
        EXPECT_FALSE(ValidateBucketName(refused, why)) << refused;
        EXPECT_NE(why.find("bucket name"), std::string::npos) << why;
    }
}
