// CredentialChain with scripted links and a hand-moved clock; HostCredentials, the host's whole
// chain, against stand-ins on 127.0.0.1. Faults guarded: a source asked out of order or after one
// gave credentials; long-term keys handed out unexchanged, or a refused exchange that ends the
// chain; credentials not renewed 5 minutes before they expire (or at half a short life), dropped
// while they still work, or kept past expiry; a secret in the log; the renewal thread not handing
// over fresh credentials; an absent source that is slow.
#include <gtest/gtest.h>

#include <atomic>
#include <mutex>

#include "platform/awsauth/CredentialChain.h"
#include "platform/framework/HostCredentials.h"
#include "tests/support/AwsStandIns.h"
#include "tests/support/LogCapture.h"
#include "tests/support/TestSupport.h"

using namespace awsauth;
using namespace std::chrono;
using namespace testsupport;

namespace {

using Variables = std::map<std::string, std::string>;
const Clock::time_point kStart = Clock::from_time_t(1800000000);

// A link that answers what the test put in `next`, counting how often it was asked.
struct ScriptedLink {
    Lookup next;
    int asked = 0;
    ChainLink Link(const std::string& name) {
        return {name, [this] {
                    ++asked;
                    return next;
                }};
    }
};

AwsCredentials Temporary(const std::string& key, std::optional<Clock::time_point> expiration) {
    return {key, "secret-" + key, "token-" + key, expiration};
}

}  // namespace

TEST(CredentialChainTest, FirstSourceThatWorksInOrderWithLongTermKeysExchanged) {
    ScriptedLink a, b, c;
    int exchanged = 0;
    Lookup exchange = Lookup::Found(Temporary("ASIAEXCHANGED", kStart + hours(12)));
    CredentialChain chain(
        {a.Link("a"), b.Link("b"), c.Link("c")},
        [&](const AwsCredentials& keys) {
            ++exchanged;
            EXPECT_EQ(keys.secretKey, "long-term-secret");
            return exchange;
        },
        [] { return kStart; });
    const struct {
        Lookup a, b, c, exchange;
        bool ok;
        std::string source, key;  // key: the access key, or a part of `why`
        int exchanges;
    } cases[] = {
        {Lookup::Absent("no a"), Lookup::Found(Temporary("ASIAB", std::nullopt)),
         Lookup::Failed("never asked"), exchange, true, "b", "ASIAB", 0},
        {Lookup::Failed("a broke"), Lookup::Absent("no b"),
         Lookup::Found({"AKIAC", "long-term-secret", "", std::nullopt}), exchange, true,
         "c via STS GetSessionToken", "ASIAEXCHANGED", 1},
        // A refused exchange passes on to the next source.
        {Lookup::Found({"AKIAA", "long-term-secret", "", std::nullopt}),
         Lookup::Found(Temporary("ASIAB", std::nullopt)), Lookup::Absent(""),
         Lookup::Failed("STS GetSessionToken: HTTP 403 AccessDenied"), true, "b", "ASIAB", 1},
        {Lookup::Absent("no a"), Lookup::Failed("b broke"), Lookup::Absent("no c"), exchange, false,
         "", "a: no a; b: b broke; c: no c", 0},
    };
    for (const auto& test : cases) {
        a.next = test.a, b.next = test.b, c.next = test.c, exchange = test.exchange;
        exchanged = 0;
        CredentialChain::Answer answer = chain.Get(true);
        EXPECT_EQ(answer.ok, test.ok) << answer.why;
        EXPECT_EQ(answer.source, test.source);
        EXPECT_NE((test.ok ? answer.credentials.accessKey : answer.why).find(test.key),
                  std::string::npos)
            << answer.why;
        EXPECT_EQ(exchanged, test.exchanges);
    }
    EXPECT_EQ(c.asked, 2);  // never once a source before it gave credentials
}

// Kept until 5 minutes before the expiration, then renewed; short-lived ones at half their life;
// the source is logged when it changes only, never a secret.
TEST(CredentialChainTest, KeepsCredentialsUntilFiveMinutesBeforeTheyExpire) {
    LogCapture capture;
    Clock::time_point now = kStart;
    ScriptedLink first, second;
    first.next = Lookup::Found(Temporary("ASIA1", kStart + hours(1)));
    second.next = Lookup::Absent("none");
    CredentialChain chain({first.Link("first"), second.Link("second")}, nullptr,
                          [&] { return now; });

    const struct {
        seconds at;  // since kStart
        bool refresh;
        Lookup firstGives;
        int asked;        // first.asked after the Get
        std::string key;  // the access key handed out, "" for none
    } steps[] = {
        {seconds(0), false, first.next, 1, "ASIA1"},
        {minutes(54), false, Lookup::Failed("not asked"), 1, "ASIA1"},  // kept
        {minutes(55), false, Lookup::Found(Temporary("ASIA2", kStart + minutes(57))), 2, "ASIA2"},
        // ASIA2 came with 2 minutes to live: renewed after half of that.
        {minutes(55) + seconds(59), false, Lookup::Failed("not asked"), 2, "ASIA2"},
        // A renewal that fails keeps what still works, until it expires.
        {minutes(56), false, Lookup::Failed("down"), 3, "ASIA2"},
        {minutes(57), false, Lookup::Failed("down"), 4, ""},
        {minutes(58), false, Lookup::Found(Temporary("ASIA3", std::nullopt)), 5, "ASIA3"},
        {hours(100), false, Lookup::Failed("not asked"), 5, "ASIA3"},  // does not expire
        {hours(100), true, Lookup::Found(Temporary("ASIA4", std::nullopt)), 6, "ASIA4"},
    };
    for (const auto& step : steps) {
        SCOPED_TRACE(step.at.count());
        now = kStart + step.at;
        first.next = step.firstGives;
        CredentialChain::Answer answer = chain.Get(step.refresh);
        EXPECT_EQ(first.asked, step.asked);
        EXPECT_EQ(answer.ok ? answer.credentials.accessKey : "", step.key) << answer.why;
    }
    EXPECT_EQ(chain.RefreshAt(), std::nullopt);
    EXPECT_EQ(capture.Count("AWS credentials from first"), 2u);  // again after the gap
    EXPECT_EQ(capture.CountContaining("secret-"), 0u);
}

// Only a profile with an IAM user's keys: the whole chain runs, every source before the profile
// is absent, STS turns the keys into temporary ones, and the renewal thread hands over new ones
// before they expire. Then nothing at all: every source absent quickly, each named.
TEST(HostCredentialsConcurrencyTest, WholeChainFromAStaticKeyProfileWithRenewal) {
    std::atomic<int> issued{0};
    ScriptedHttpServer sts([&](const HttpRequestSeen& request) {
        // 5 minutes and 1 s to live: due for renewal a second after being issued.
        return StsCredentialsAnswer(FormValue(request.body, "Action"),
                                    "ASIA" + std::to_string(++issued), "tmp-secret", "tmp-token",
                                    system_clock::now() + minutes(5) + seconds(1));
    });
    ScriptedHttpServer imds(ScriptedHttpServer::Mode::kStall);
    const std::string dir = ScratchDir("hostcredentials");
    Variables variables = {
        {"HOME", dir + "/home"},
        {"AWS_SHARED_CREDENTIALS_FILE", WriteFile(dir + "/credentials",
                                                  "[default]\naws_access_key_id = AKIAUSER\n"
                                                  "aws_secret_access_key = user-secret\n")},
        {"AWS_ENDPOINT_URL_STS", sts.Endpoint()},
        {"AWS_EC2_METADATA_SERVICE_ENDPOINT", imds.Endpoint()}};
    FrameworkOptions options;
    options.region = "eu-west-1";
    LogCapture capture;
    {
        HostCredentials host(options, EnvOf(variables));
        credentials::Result first = host.Fetch(false);
        ASSERT_TRUE(first.ok) << first.why;
        EXPECT_EQ(first.source, "shared config files via STS GetSessionToken");
        EXPECT_EQ(first.properties.at("awsAccessKey"), "ASIA1");
        EXPECT_EQ(first.properties.at("sessionToken"), "tmp-token");
        EXPECT_EQ(FormValue(sts.Requests().at(0).body, "Action"), "GetSessionToken");
        EXPECT_NE(sts.Requests().at(0).Header("Authorization").find("Credential=AKIAUSER/"),
                  std::string::npos);

        std::mutex mutex;
        std::vector<std::string> renewed;  // access keys handed over by the renewal thread
        host.StartRenewing([&](const credentials::Result& result) {
            std::lock_guard<std::mutex> lock(mutex);
            renewed.push_back(result.properties.at("awsAccessKey"));
        });
        ASSERT_TRUE(WaitUntil(
            [&] {
                std::lock_guard<std::mutex> lock(mutex);
                return renewed.size() >= 2;
            },
            20000));
        host.Stop();
        EXPECT_EQ(renewed[0], "ASIA2");
        EXPECT_EQ(renewed[1], "ASIA3");
        EXPECT_EQ(imds.Connections(), 0);  // the profile came first
    }
    EXPECT_EQ(capture.CountContaining("user-secret") + capture.CountContaining("tmp-secret"), 0u);

    variables.erase("AWS_SHARED_CREDENTIALS_FILE");
    const auto started = steady_clock::now();
    credentials::Result none = HostCredentials(options, EnvOf(variables)).Fetch(false);
    EXPECT_LT(steady_clock::now() - started, seconds(5));
    EXPECT_FALSE(none.ok);
    for (const char* source : {"environment: ", "web identity: ", "shared config files: ",
                               "container endpoint: ", "instance metadata: "})
        EXPECT_NE(none.why.find(source), std::string::npos) << none.why;
}

// Long-term keys that STS does not exchange (none answers here), from a credential process or
// the environment, pass on to the next source. (That a credential process is asked again, never
// cached, EndToEndTest.ToS3rverWithCredentialsFromACredentialProcess shows.)
TEST(HostCredentialsTest, CredentialProcessThenTheEnvironment) {
    FrameworkOptions options;
    options.region = "eu-west-3";
    options.credentialProcess = "echo '{\"AccessKeyId\":\"a\",\"SecretAccessKey\":\"b\"}'";
    Variables variables = {{"AWS_ENDPOINT_URL_STS", "http://127.0.0.1:9"},
                           {"HOME", "/nonexistent"},
                           {"AWS_EC2_METADATA_DISABLED", "true"},
                           {"AWS_ACCESS_KEY_ID", "AKIDENV"},
                           {"AWS_SECRET_ACCESS_KEY", "envsecret"}};
    const credentials::Result none = HostCredentials(options, EnvOf(variables)).Fetch(false);
    EXPECT_FALSE(none.ok);
    EXPECT_NE(none.why.find("credential process: long-term keys not exchanged"), std::string::npos)
        << none.why;
    EXPECT_NE(none.why.find("environment: long-term keys not exchanged"), std::string::npos);
    variables["AWS_SESSION_TOKEN"] = "envtoken";
    const credentials::Result env = HostCredentials(options, EnvOf(variables)).Fetch(false);
    ASSERT_TRUE(env.ok) << env.why;
    for (const auto& [name, value] : Variables{{"awsAccessKey", "AKIDENV"},
                                               {"awsSecretKey", "envsecret"},
                                               {"sessionToken", "envtoken"},
                                               {"region", "eu-west-3"}})
        EXPECT_EQ(env.properties.at(name), value) << name;
}
