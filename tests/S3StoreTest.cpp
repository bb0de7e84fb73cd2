// S3Store against s3rver on 127.0.0.1 (read back with awscli) and against scripted TCP peers
// for the answers and failures s3rver cannot give.
#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <atomic>
#include <random>
#include <thread>
#include <vector>

#include "platform/logger/LogCapture.h"
#include "platform/transfer/Digest.h"
#include "platform/transfer/S3Response.h"
#include "platform/transfer/S3Store.h"
#include "platform/transfer/S3Target.h"
#include "tests/support/S3rver.h"
#include "tests/support/TestSupport.h"

using namespace std::chrono;
using testsupport::S3rver;

namespace {

std::string RandomBytes(size_t size, unsigned seed) {
    std::mt19937 random(seed);
    std::string out(size, '\0');
    for (char& c : out) c = static_cast<char>(random());
    return out;
}

ObjectToStore Object(const std::string& key, const std::string& body,
                     const std::string& bucket = S3rver::kBucket) {
    ObjectToStore object;
    object.bucket = bucket;
    object.key = key;
    object.contentType = "video/mp2t";
    object.metadata = {{"streamingid", "cam 1"}, {"sequencenumber", "7"}, {"duration", "10000"}};
    object.data = reinterpret_cast<const uint8_t*>(body.data());
    object.size = body.size();
    return object;
}

StoreCredentials Credentials(const std::string& secret = S3rver::kSecretKey) {
    return {S3rver::kAccessKey, secret, "tok-EN/with+chars==", "us-east-1", false};
}

S3StoreConfig Config(const std::string& endpoint) {
    S3StoreConfig config;
    std::string why;
    EXPECT_TRUE(S3StoreConfig::Parse(endpoint, config, why)) << why;
    return config;
}

// A TCP peer on 127.0.0.1, on its own thread, that stalls (accepts, never answers), resets each
// connection, or reads each request (headers and Content-Length body) and sends `response`.
class FakeServer {
  public:
    enum class Mode { kStall, kReset, kRespond };
    explicit FakeServer(Mode mode, std::string response = "")
        : mode_(mode), response_(std::move(response)) {
        listen_ = socket(AF_INET, SOCK_STREAM, 0);
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        bind(listen_, reinterpret_cast<sockaddr*>(&address), sizeof address);
        listen(listen_, 8);
        socklen_t length = sizeof address;
        getsockname(listen_, reinterpret_cast<sockaddr*>(&address), &length);
        port_ = ntohs(address.sin_port);
        if (pipe(stop_) != 0) ADD_FAILURE() << "pipe";
        thread_ = std::thread([this] { Run(); });
    }
    ~FakeServer() {
        if (write(stop_[1], "x", 1) != 1) ADD_FAILURE() << "stop";
        thread_.join();
        for (int fd : held_) close(fd);
        for (int fd : {listen_, stop_[0], stop_[1]}) close(fd);
    }
    int Port() const { return port_; }
    std::string Endpoint() const { return "http://127.0.0.1:" + std::to_string(port_); }
    int Connections() const { return connections_.load(); }
    std::string Request() const {
        std::lock_guard<std::mutex> lock(mutex_);
        return request_;
    }

  private:
    void Run() {
        while (true) {
            pollfd fds[2] = {{listen_, POLLIN, 0}, {stop_[0], POLLIN, 0}};
            if (poll(fds, 2, -1) < 0 || fds[1].revents != 0) return;
            int fd = accept(listen_, nullptr, nullptr);
            if (fd < 0) continue;
            ++connections_;
            if (mode_ == Mode::kStall) {
                held_.push_back(fd);
                continue;
            }
            if (mode_ == Mode::kReset) {
                linger hard{1, 0};
                setsockopt(fd, SOL_SOCKET, SO_LINGER, &hard, sizeof hard);
            } else {
                Answer(fd);
            }
            close(fd);
        }
    }
    void Answer(int fd) {
        timeval limit{5, 0};
        setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit);
        std::string request;
        char buffer[65536];
        size_t wanted = std::string::npos;
        while (wanted == std::string::npos || request.size() < wanted) {
            ssize_t n = recv(fd, buffer, sizeof buffer, 0);
            if (n <= 0) break;
            request.append(buffer, static_cast<size_t>(n));
            size_t end = request.find("\r\n\r\n");
            if (wanted == std::string::npos && end != std::string::npos) {
                size_t at = request.find("Content-Length: ");
                wanted =
                    end + 4 + (at == std::string::npos ? 0 : std::stoul(request.substr(at + 16)));
            }
        }
        {
            std::lock_guard<std::mutex> lock(mutex_);
            request_ = request;
        }
        if (send(fd, response_.data(), response_.size(), MSG_NOSIGNAL) < 0) return;
    }

    const Mode mode_;
    const std::string response_;
    int listen_ = -1;
    int port_ = 0;
    int stop_[2] = {-1, -1};
    std::vector<int> held_;  // stalled connections, closed at the end
    std::atomic<int> connections_{0};
    mutable std::mutex mutex_;
    std::string request_;  // the last request read, headers and body
    std::thread thread_;
};

std::string HttpAnswer(const std::string& statusLine, const std::string& headers,
                       const std::string& body = "") {
    return "HTTP/1.1 " + statusLine + "\r\n" + headers +
           "Content-Length: " + std::to_string(body.size()) + "\r\nConnection: close\r\n\r\n" +
           body;
}

std::string ErrorAnswer(const std::string& statusLine, const std::string& code) {
    return HttpAnswer(statusLine, "Content-Type: application/xml\r\n",
                      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<Error><Code>" + code +
                          "</Code><Message>scripted</Message></Error>");
}

class S3StoreTest : public ::testing::Test {
  protected:
    void SetUp() override {
        ASSERT_TRUE(server_.Start(std::string(SFR_SOURCE_DIR) + "/scripts/s3rver.sh",
                                  testsupport::BuildPath("node")))
            << server_.Error();
    }
    // Runs awscli against the server with the test key pair.
    testsupport::ProcessResult Aws(std::vector<std::string> args) {
        std::vector<std::string> argv = {"env",
                                         std::string("AWS_ACCESS_KEY_ID=") + S3rver::kAccessKey,
                                         std::string("AWS_SECRET_ACCESS_KEY=") + S3rver::kSecretKey,
                                         "AWS_DEFAULT_REGION=us-east-1",
                                         "AWS_EC2_METADATA_DISABLED=true",
                                         "AWS_CONFIG_FILE=/dev/null",
                                         "AWS_SHARED_CREDENTIALS_FILE=/dev/null",
                                         "/usr/bin/aws",
                                         "--endpoint-url",
                                         server_.Endpoint()};
        argv.insert(argv.end(), args.begin(), args.end());
        return testsupport::RunProcess(argv, 120000);
    }

    S3rver server_;
};

}  // namespace

TEST_F(S3StoreTest, StoresObjectsByteIdenticalWithMetadata) {
    S3Store store(Config(server_.Endpoint()));
    // Every character that needs encoding in a path; a second object over the reused connection.
    const std::string key = "pre fix/cam:1/2026/01/02/cam=1_20260102T030405.678Z_1 (a+b)!.ts";
    const std::string body = RandomBytes(300 * 1024 + 17, 1), body2 = RandomBytes(1000, 2);
    FileTransferInfo info;
    ASSERT_EQ(store.Put(Object(key, body), Credentials(), &info), Success);
    EXPECT_EQ(info.fileSize, body.size());
    ObjectToStore second = Object("cam1/second.ts", body2);
    second.metadata["empty"] = "";  // signed and sent as an empty header
    ASSERT_EQ(store.Put(second, Credentials(), &info), Success);

    const std::string copy = testsupport::BuildPath("s3store-copy-" + std::to_string(getpid()));
    auto cp = Aws({"s3", "cp", std::string("s3://") + S3rver::kBucket + "/" + key, copy});
    ASSERT_EQ(cp.exitStatus, 0) << cp.output;
    EXPECT_TRUE(testsupport::ReadFile(copy) == body);
    unlink(copy.c_str());

    auto head = Aws({"s3api", "head-object", "--bucket", S3rver::kBucket, "--key", key});
    ASSERT_EQ(head.exitStatus, 0) << head.output;
    for (const std::string& expected :
         {std::string("\"ContentType\": \"video/mp2t\""), std::string("\"streamingid\": \"cam 1\""),
          std::string("\"sequencenumber\": \"7\""), std::string("\"duration\": \"10000\""),
          digest::Hex(digest::Md5Of(body.data(), body.size()))}) {
        EXPECT_NE(head.output.find(expected), std::string::npos) << expected << head.output;
    }
}

// Refusals, a clock 20 minutes ahead corrected from the refusal, and the server gone; nothing of
// the credentials reaches the log at any priority.
TEST_F(S3StoreTest, RejectionsAndSkewAndNoCredentialsInTheLog) {
    LogCapture capture;
    const std::string body = RandomBytes(4096, 3);
    FileTransferInfo info;
    S3StoreConfig skewed = Config(server_.Endpoint());
    skewed.clockOffset = minutes(20);
    S3Store store(skewed);
    EXPECT_EQ(store.Put(Object("skew.ts", body), Credentials(), &info), RequestTimeTooSkewed);
    EXPECT_LE(std::abs(store.ClockOffset().count()), 2);
    EXPECT_EQ(store.Put(Object("skew.ts", body), Credentials(), &info), Success);

    const StoreCredentials wrong = Credentials("wrong-secret-value");
    EXPECT_EQ(store.Put(Object("k.ts", body), wrong, &info), AuthenticationError);
    EXPECT_EQ(info.fileSize, 0u);
    StoreCredentials unknown = Credentials();
    unknown.accessKey = "AKIDUNKNOWN";
    EXPECT_EQ(store.Put(Object("k.ts", body), unknown, &info), AuthenticationError);
    EXPECT_EQ(store.Put(Object("k.ts", body, "no-such-bucket"), Credentials(), &info),
              FilePathError);
    server_.Stop();
    EXPECT_EQ(store.Put(Object("k.ts", body), Credentials(), &info), NetworkError);

    ASSERT_FALSE(capture.Records().empty());
    for (const auto& record : capture.Records()) {
        for (const std::string& secret :
             {std::string(S3rver::kSecretKey), wrong.secretKey, wrong.sessionToken,
              std::string("Signature="), std::string("Credential="), std::string("AWS4-HMAC"),
              std::string(S3rver::kAccessKey)}) {
            EXPECT_EQ(record.message.find(secret), std::string::npos) << record.message;
        }
    }
}

// What the request carries, as a scripted server receives it; and how scripted answers map.
TEST(S3StoreScriptedTest, RequestHeadersAndAnswers) {
    const std::string body = RandomBytes(70000, 4);
    const std::string md5Hex = digest::Hex(digest::Md5Of(body.data(), body.size()));
    FakeServer ok(FakeServer::Mode::kRespond, HttpAnswer("200 OK", "ETag: \"" + md5Hex + "\"\r\n"));
    S3Store store(Config(ok.Endpoint()));
    FileTransferInfo info;
    ASSERT_EQ(store.Put(Object("a b/c.ts", body), Credentials(), &info), Success);
    EXPECT_EQ(info.fileSize, body.size());
    const std::string request = ok.Request();
    const std::string head = request.substr(0, request.find("\r\n\r\n") + 4);
    EXPECT_EQ(head.rfind("PUT /rec/a%20b/c.ts HTTP/1.1\r\n", 0), 0u) << head;
    for (const std::string& header :
         {"content-md5: " + digest::Base64(digest::Md5Of(body.data(), body.size())) + "\r\n",
          "x-amz-content-sha256: " + digest::Hex(digest::Sha256Of(body.data(), body.size())),
          std::string("content-type: video/mp2t\r\n"),
          std::string("x-amz-security-token: tok-EN/with+chars==\r\n"),
          std::string("x-amz-meta-streamingid: cam 1\r\n"),
          "Host: 127.0.0.1:" + std::to_string(ok.Port()) + "\r\n"}) {
        EXPECT_NE(head.find(header), std::string::npos) << header << head;
    }
    EXPECT_EQ(head.find("Expect:"), std::string::npos);
    EXPECT_TRUE(request.substr(head.size()) == body);

    // A header value cannot smuggle in a header of its own.
    ObjectToStore sneaky = Object("s.ts", body);
    sneaky.metadata["note"] = "x\r\nx-amz-acl: public-read";
    ASSERT_EQ(store.Put(sneaky, Credentials(), &info), Success);
    EXPECT_EQ(ok.Request().find("\r\nx-amz-acl"), std::string::npos);
    EXPECT_NE(ok.Request().find("\r\nx-amz-meta-note: x__x-amz-acl: public-read\r\n"),
              std::string::npos);

    const std::pair<std::string, FileTransferResult> cases[] = {
        {HttpAnswer("200 OK", "ETag: \"00000000000000000000000000000000\"\r\n"), FileBroken},
        {HttpAnswer("200 OK", ""), FileBroken},
        {ErrorAnswer("500 Internal Server Error", "InternalError"), InternalError},
        {ErrorAnswer("503 Slow Down", "SlowDown"), InternalError},
        {ErrorAnswer("400 Bad Request", "BadDigest"), FileBroken},
        {ErrorAnswer("400 Bad Request", "XAmzContentSHA256Mismatch"), FileBroken},
        {ErrorAnswer("400 Bad Request", "ExpiredToken"), AuthenticationError},
        {ErrorAnswer("403 Forbidden", "TokenRefreshRequired"), AuthenticationError},
        {ErrorAnswer("404 Not Found", "NoSuchBucket"), FilePathError},
    };
    for (const auto& [answer, expected] : cases) {
        FakeServer server(FakeServer::Mode::kRespond, answer);
        EXPECT_EQ(
            S3Store(Config(server.Endpoint())).Put(Object("k.ts", body), Credentials(), &info),
            expected)
            << answer;
        EXPECT_EQ(info.fileSize, 0u);
    }
}

TEST(S3StoreScriptedTest, BrokenConnectionsAndMissingCredentials) {
    FileTransferInfo info;
    const std::string body = RandomBytes(100000, 5);
    FakeServer reset(FakeServer::Mode::kReset);
    EXPECT_EQ(S3Store(Config(reset.Endpoint())).Put(Object("k.ts", body), Credentials(), &info),
              NetworkError);
    EXPECT_EQ(S3Store(Config("http://no-such-host.invalid:9"))
                  .Put(Object("k.ts", body), Credentials(), &info),
              NetworkError);

    // Nothing is sent without credentials.
    FakeServer idle(FakeServer::Mode::kStall);
    S3Store idleStore(Config(idle.Endpoint()));
    StoreCredentials noSecret = Credentials();
    noSecret.secretKey.clear();
    for (const StoreCredentials& none : {noSecret, StoreCredentials{}})
        EXPECT_EQ(idleStore.Put(Object("k.ts", body), none, &info), AuthenticationError);
    EXPECT_EQ(idle.Connections(), 0);

    // A stalled server: the low-speed limit (1 s here) ends the transfer.
    S3StoreConfig config = Config(idle.Endpoint());
    config.lowSpeedTimeS = 1;
    auto started = steady_clock::now();
    EXPECT_EQ(S3Store(config).Put(Object("k.ts", body.substr(0, 200)), Credentials(), &info),
              TimeOut);
    EXPECT_LT(steady_clock::now() - started, seconds(20));
    EXPECT_GE(info.responseTime, 900u);
}

// Cancel comes from another thread while Put waits for an answer that never comes.
TEST(S3StoreConcurrencyTest, CancelEndsStalledTransferAndEveryLaterOne) {
    FakeServer stall(FakeServer::Mode::kStall);
    S3Store store(Config(stall.Endpoint()));  // the 30 s low-speed limit never fires here
    const std::string body = RandomBytes(10000, 7);
    std::atomic<int> result{-1};
    std::atomic<int64_t> endedNs{0};
    std::thread upload([&] {
        FileTransferInfo info;
        result = static_cast<int>(store.Put(Object("k.ts", body), Credentials(), &info));
        endedNs = steady_clock::now().time_since_epoch().count();
    });
    ASSERT_TRUE(testsupport::WaitUntil([&] { return stall.Connections() == 1; }));
    auto cancelled = steady_clock::now();
    store.Cancel();
    upload.join();
    EXPECT_EQ(result.load(), static_cast<int>(TimeOut));
    EXPECT_LT(steady_clock::time_point(steady_clock::duration(endedNs.load())) - cancelled,
              milliseconds(100));

    FileTransferInfo info;
    auto later = steady_clock::now();
    EXPECT_EQ(store.Put(Object("k.ts", body), Credentials(), &info), TimeOut);
    EXPECT_LT(steady_clock::now() - later, milliseconds(100));
    EXPECT_EQ(stall.Connections(), 1);
}

TEST(S3StoreConfigTest, ParsesEndpoints) {
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
}

TEST(S3StoreConfigTest, ReadsServerAnswers) {
    EXPECT_EQ(ClassifyS3Answer(403, "RequestTimeTooSkewed"), RequestTimeTooSkewed);
    EXPECT_EQ(ClassifyS3Answer(403, "SomethingNew"), AuthenticationError);
    EXPECT_EQ(ClassifyS3Answer(301, "PermanentRedirect"), FilePathError);
    EXPECT_EQ(ClassifyS3Answer(400, "InvalidArgument"), InternalError);
    EXPECT_TRUE(
        EtagMatches("\"900150983CD24FB0D6963F7D28E17F72\"", "900150983cd24fb0d6963f7d28e17f72"));
    EXPECT_FALSE(
        EtagMatches("\"900150983cd24fb0d6963f7d28e17f72-2\"", "900150983cd24fb0d6963f7d28e17f72"));

    system_clock::time_point t;
    ASSERT_TRUE(ParseServerTime("Fri, 24 May 2013 00:00:00 GMT", t));
    EXPECT_EQ(system_clock::to_time_t(t), 1369353600);
    ASSERT_TRUE(ParseServerTime("2013-05-24T00:00:01Z", t));
    EXPECT_EQ(system_clock::to_time_t(t), 1369353601);
    EXPECT_FALSE(ParseServerTime("Fri, 24 Foo 2013 00:00:00 GMT", t));
}

TEST(S3StoreConfigTest, AddressesObjects) {
    StoreCredentials routing{"ak", "sk", "", "eu-west-1", false};
    S3Target t;
    std::string why;
    ASSERT_TRUE(S3TargetFor("", "my-bucket", "cam 1/a+b.ts", routing, t, why));
    EXPECT_EQ(t.url, "https://my-bucket.s3.eu-west-1.amazonaws.com/cam%201/a%2Bb.ts");
    EXPECT_EQ(t.host, "my-bucket.s3.eu-west-1.amazonaws.com");
    EXPECT_EQ(t.canonicalUri, "/cam%201/a%2Bb.ts");

    routing.accelerate = true;
    ASSERT_TRUE(S3TargetFor("", "my-bucket", "k.ts", routing, t, why));
    EXPECT_EQ(t.url, "https://my-bucket.s3-accelerate.amazonaws.com/k.ts");
    EXPECT_EQ(t.signingRegion, "eu-west-1");
    // Acceleration is an AWS service: a custom endpoint stays path-style.
    ASSERT_TRUE(S3TargetFor("http://127.0.0.1:9000", "rec", "a/b c.ts", routing, t, why));
    EXPECT_EQ(t.url, "http://127.0.0.1:9000/rec/a/b%20c.ts");
    EXPECT_EQ(t.host, "127.0.0.1:9000");

    routing = StoreCredentials{"ak", "sk", "", "", false};
    ASSERT_TRUE(S3TargetFor("", "b", "k", routing, t, why));
    EXPECT_EQ(t.signingRegion, "us-east-1");
    EXPECT_FALSE(S3TargetFor("", "Bad_Bucket", "k", routing, t, why));
    EXPECT_FALSE(S3TargetFor("", "b", "", routing, t, why));
    routing.region = "eu-west-1.evil.example/";
    EXPECT_FALSE(S3TargetFor("", "b", "k", routing, t, why));
}
