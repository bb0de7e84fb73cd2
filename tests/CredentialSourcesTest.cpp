// The credential sources of the chain, each against a stand-in on 127.0.0.1 that answers as
// the real service does: the container endpoint, the instance metadata service (IMDSv2), the
// shared config files' profiles (STS AssumeRole and friends) and web identity; and the private
// CA bundle that their client and the S3 store trust.
#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <map>

#include "platform/awsauth/ContainerCredentials.h"
#include "platform/awsauth/HttpClient.h"
#include "platform/awsauth/InstanceMetadata.h"
#include "platform/awsauth/ProfileCredentials.h"
#include "platform/awsauth/WebIdentityCredentials.h"
#include "platform/transfer/S3Store.h"
#include "tests/support/AwsStandIns.h"
#include "tests/support/LogCapture.h"
#include "tests/support/ScriptedHttpServer.h"
#include "tests/support/TestSupport.h"

using namespace awsauth;
using testsupport::FormValue;
using testsupport::HttpAnswer;
using testsupport::HttpRequestSeen;
using testsupport::ScriptedHttpServer;
using Variables = std::map<std::string, std::string>;

namespace {

const auto kLater = std::chrono::system_clock::now() + std::chrono::hours(1);

Environment Env(const Variables& variables) {
    return [variables](const std::string& name) {
        auto it = variables.find(name);
        return it == variables.end() ? std::string() : it->second;
    };
}

// A fresh directory in the build tree for this test's files.
std::string Scratch(const std::string& name) {
    std::string dir =
        testsupport::BuildPath("credsources/" + name + "-" + std::to_string(getpid()));
    std::filesystem::remove_all(dir);
    std::filesystem::create_directories(dir);
    return dir;
}

std::string Write(const std::string& path, const std::string& text) {
    std::ofstream(path) << text;
    return path;
}

// STS stand-in: every action answers with credentials named after it and the role asked for.
std::string StsAnswer(const HttpRequestSeen& request) {
    const std::string action = FormValue(request.body, "Action");
    std::string arn = FormValue(request.body, "RoleArn");
    return testsupport::StsCredentialsAnswer(
        action, "ASIA-" + action + "-" + arn.substr(arn.rfind('/') + 1), "s-" + action,
        "t-" + action, kLater);
}

}  // namespace

TEST(ContainerCredentialsTest, ChoosesOnlyUrlsTheTokenMayTravelTo) {
    const struct {
        Variables variables;
        std::string url;  // "" when refused
    } cases[] = {
        {{{"AWS_CONTAINER_CREDENTIALS_RELATIVE_URI", "/v2/credentials/abc"}},
         "http://169.254.170.2/v2/credentials/abc"},
        {{{"AWS_CONTAINER_CREDENTIALS_RELATIVE_URI", "/v2/x"},
          {"AWS_CONTAINER_CREDENTIALS_FULL_URI", "http://127.0.0.1:1/y"}},
         "http://169.254.170.2/v2/x"},
        {{{"AWS_CONTAINER_CREDENTIALS_FULL_URI", "http://169.254.170.23/v1/credentials"}},
         "http://169.254.170.23/v1/credentials"},
        {{{"AWS_CONTAINER_CREDENTIALS_FULL_URI", "http://[fd00:ec2::23]/c"}},
         "http://[fd00:ec2::23]/c"},
        {{{"AWS_CONTAINER_CREDENTIALS_FULL_URI", "https://creds.example.com/c"}},
         "https://creds.example.com/c"},
        {{{"AWS_CONTAINER_CREDENTIALS_FULL_URI", "http://creds.example.com/c"}}, ""},
        {{{"AWS_CONTAINER_CREDENTIALS_FULL_URI", "http://10.0.0.1/c"}}, ""},
        {{{"AWS_CONTAINER_CREDENTIALS_FULL_URI", "http://127.0.0.1@evil.example/c"}}, ""},
        {{{"AWS_CONTAINER_CREDENTIALS_FULL_URI", "file:///etc/passwd"}}, ""},
    };
    for (const auto& c : cases) {
        std::string why;
        EXPECT_EQ(ContainerCredentials(Env(c.variables)).Url(why), c.url) << why;
        EXPECT_EQ(why.empty(), !c.url.empty());
    }
    EXPECT_EQ(ContainerCredentials(Env({})).Fetch().outcome, Lookup::Outcome::kAbsent);
}

TEST(ContainerCredentialsTest, AsksWithTheAuthorizationTokenOfTheMoment) {
    ScriptedHttpServer agent([](const HttpRequestSeen& request) {
        if (request.Header("Authorization").rfind("token-", 0) != 0)
            return HttpAnswer("401 Unauthorized", "");
        return HttpAnswer("200 OK", "Content-Type: application/json\r\n",
                          testsupport::CredentialsJson("ASIACONTAINER", "c-secret",
                                                       request.Header("Authorization"), kLater));
    });
    const std::string dir = Scratch("container");
    const std::string tokenFile = Write(dir + "/token", "token-1\n");
    Variables variables = {{"AWS_CONTAINER_CREDENTIALS_FULL_URI", agent.Endpoint() + "/v1/creds"},
                           {"AWS_CONTAINER_AUTHORIZATION_TOKEN", "token-env"},
                           {"AWS_CONTAINER_AUTHORIZATION_TOKEN_FILE", tokenFile}};
    ContainerCredentials container(Env(variables));
    Lookup first = container.Fetch();
    ASSERT_TRUE(first.Ok()) << first.why;
    EXPECT_EQ(first.credentials.accessKey, "ASIACONTAINER");
    EXPECT_EQ(first.credentials.sessionToken, "token-1");  // the file wins over the variable
    ASSERT_TRUE(first.credentials.expiration.has_value());
    Write(tokenFile, "token-2");  // the agent rotated it
    EXPECT_EQ(container.Fetch().credentials.sessionToken, "token-2");
    EXPECT_EQ(agent.Requests().back().target, "/v1/creds");

    variables.erase("AWS_CONTAINER_AUTHORIZATION_TOKEN_FILE");
    EXPECT_EQ(ContainerCredentials(Env(variables)).Fetch().credentials.sessionToken, "token-env");
    variables["AWS_CONTAINER_AUTHORIZATION_TOKEN"] = "wrong";
    Lookup refused = ContainerCredentials(Env(variables)).Fetch();
    EXPECT_EQ(refused.outcome, Lookup::Outcome::kFailed);
    EXPECT_NE(refused.why.find("HTTP 401"), std::string::npos) << refused.why;
}

// The documented IMDSv2 exchange: a session token first, then the role, then its credentials,
// each later request carrying the token.
TEST(InstanceMetadataTest, FetchesTheRoleCredentialsWithASessionToken) {
    bool roleAttached = true;
    ScriptedHttpServer imds([&](const HttpRequestSeen& request) {
        if (request.method == "PUT" && request.target == "/latest/api/token") {
            return request.Header("X-aws-ec2-metadata-token-ttl-seconds") == "21600"
                       ? HttpAnswer("200 OK", "", "IMDS-TOKEN")
                       : HttpAnswer("400 Bad Request", "");
        }
        if (request.Header("X-aws-ec2-metadata-token") != "IMDS-TOKEN")
            return HttpAnswer("401 Unauthorized", "");
        if (request.target == "/latest/meta-data/iam/security-credentials/")
            return roleAttached ? HttpAnswer("200 OK", "", "recorder-role")
                                : HttpAnswer("404 Not Found", "");
        if (request.target == "/latest/meta-data/iam/security-credentials/recorder-role")
            return HttpAnswer(
                "200 OK", "",
                testsupport::CredentialsJson("ASIAIMDS", "i-secret", "i-token", kLater));
        return HttpAnswer("404 Not Found", "");
    });
    InstanceMetadata metadata(Env({{"AWS_EC2_METADATA_SERVICE_ENDPOINT", imds.Endpoint() + "/"}}));
    Lookup found = metadata.Fetch();
    ASSERT_TRUE(found.Ok()) << found.why;
    EXPECT_EQ(found.credentials.accessKey, "ASIAIMDS");
    EXPECT_EQ(found.credentials.sessionToken, "i-token");
    EXPECT_EQ(imds.Requests().size(), 3u);

    roleAttached = false;
    EXPECT_EQ(metadata.Fetch().outcome, Lookup::Outcome::kAbsent);
    const size_t asked = imds.Requests().size();
    EXPECT_EQ(InstanceMetadata(Env({{"AWS_EC2_METADATA_SERVICE_ENDPOINT", imds.Endpoint()},
                                    {"AWS_EC2_METADATA_DISABLED", "TRUE"}}))
                  .Fetch()
                  .outcome,
              Lookup::Outcome::kAbsent);
    EXPECT_EQ(imds.Requests().size(), asked);  // turned off: not asked at all
    EXPECT_EQ(
        InstanceMetadata(Env({{"AWS_EC2_METADATA_SERVICE_ENDPOINT_MODE", "IPv6"}})).Endpoint(),
        "http://[fd00:ec2::254]");
}

// Off EC2: nothing answers, or something accepts and never answers. Either way the source is
// absent within about its 1 s bound.
TEST(InstanceMetadataTest, AnAbsentServiceFallsThroughQuickly) {
    ScriptedHttpServer stall(ScriptedHttpServer::Mode::kStall);
    const std::string closed = "http://127.0.0.1:" + std::to_string([] {
                                   ScriptedHttpServer gone(ScriptedHttpServer::Mode::kReset);
                                   return gone.Port();
                               }());
    for (const std::string& endpoint : {stall.Endpoint(), closed}) {
        const auto started = std::chrono::steady_clock::now();
        Lookup lookup =
            InstanceMetadata(Env({{"AWS_EC2_METADATA_SERVICE_ENDPOINT", endpoint}})).Fetch();
        EXPECT_EQ(lookup.outcome, Lookup::Outcome::kAbsent) << lookup.why;
        EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(5));
    }
}

TEST(ProfileCredentialsTest, ResolvesProfilesAsTheAwsCliDoes) {
    ScriptedHttpServer sts(StsAnswer);
    StsConfig stsConfig;
    stsConfig.region = "eu-west-1";
    stsConfig.endpoint = sts.Endpoint();
    StsClient client(stsConfig);
    const std::string dir = Scratch("profiles");
    Write(dir + "/web-token", "eyJ.web.token");
    const std::string config =
        "# comment\n[default]\nregion = eu-west-1\n"
        "[profile role]\nrole_arn = arn:aws:iam::1:role/rec\nsource_profile = user\n"
        "role_session_name = cam-7\nexternal_id = ext\n"
        "[profile chained]\nrole_arn = arn:aws:iam::1:role/outer\nsource_profile = role\n"
        "[profile self]\nrole_arn = arn:aws:iam::1:role/self\nsource_profile = self\n"
        "aws_access_key_id = AKIASELF\naws_secret_access_key = self-secret\n"
        "[profile loop-a]\nrole_arn = arn:aws:iam::1:role/a\nsource_profile = loop-b\n"
        "[profile loop-b]\nrole_arn = arn:aws:iam::1:role/b\nsource_profile = loop-a\n"
        "[profile proc]\ncredential_process = fetch-creds --fast\n"
        "[profile env-role]\nrole_arn = arn:aws:iam::1:role/env\ncredential_source = Environment\n"
        "[profile web]\nrole_arn = arn:aws:iam::1:role/web\nweb_identity_token_file = " +
        dir +
        "/web-token\n"
        "[profile mfa]\nrole_arn = arn:aws:iam::1:role/m\nsource_profile = user\n"
        "mfa_serial = arn:aws:iam::1:mfa/u\n"
        "[profile sso]\nsso_session = corp\nsso_account_id = 1\n"
        "[profile half]\naws_access_key_id = AKIAHALF\n"
        "[profile user]\naws_access_key_id = AKIA-FROM-CONFIG\n"
        "s3 =\n  aws_access_key_id = AKIA-NESTED\n";
    const std::string credentials =
        "[default]\naws_access_key_id = AKIADEFAULT\naws_secret_access_key = d-secret\n"
        "[user]\n; the credentials file wins over the config file\n"
        "aws_access_key_id=AKIAUSER\naws_secret_access_key = u-secret \n";
    Write(dir + "/config", config);
    Write(dir + "/credentials", credentials);

    ProfileSources sources;
    sources.process = [](const std::string& command) {
        return command == "fetch-creds --fast"
                   ? Lookup::Found({"ASIAPROC", "p-secret", "p-token", kLater})
                   : Lookup::Failed("unknown command");
    };
    sources.environment = [] { return Lookup::Found({"AKIAENV", "e-secret", "", std::nullopt}); };

    const struct {
        std::string profile;  // "" for AWS_PROFILE unset
        Lookup::Outcome outcome;
        std::string accessKey;             // when found; else a part of the reason
        std::vector<std::string> assumed;  // RoleArn of each STS request, in order
    } cases[] = {
        {"", Lookup::Outcome::kFound, "AKIADEFAULT", {}},
        {"user", Lookup::Outcome::kFound, "AKIAUSER", {}},
        {"role", Lookup::Outcome::kFound, "ASIA-AssumeRole-rec", {"arn:aws:iam::1:role/rec"}},
        {"chained",
         Lookup::Outcome::kFound,
         "ASIA-AssumeRole-outer",
         {"arn:aws:iam::1:role/rec", "arn:aws:iam::1:role/outer"}},
        {"self", Lookup::Outcome::kFound, "ASIA-AssumeRole-self", {"arn:aws:iam::1:role/self"}},
        {"proc", Lookup::Outcome::kFound, "ASIAPROC", {}},
        {"env-role", Lookup::Outcome::kFound, "ASIA-AssumeRole-env", {"arn:aws:iam::1:role/env"}},
        {"web",
         Lookup::Outcome::kFound,
         "ASIA-AssumeRoleWithWebIdentity-web",
         {"arn:aws:iam::1:role/web"}},
        {"loop-a", Lookup::Outcome::kFailed, "loops", {}},
        {"mfa", Lookup::Outcome::kFailed, "mfa_serial", {}},
        {"sso", Lookup::Outcome::kFailed, "export-credentials", {}},
        {"half", Lookup::Outcome::kFailed, "both aws_access_key_id", {}},
        {"nobody", Lookup::Outcome::kFailed, "no profile nobody", {}},
    };
    size_t seen = 0;
    for (const auto& c : cases) {
        SCOPED_TRACE(c.profile);
        Variables variables = {{"AWS_CONFIG_FILE", dir + "/config"},
                               {"AWS_SHARED_CREDENTIALS_FILE", dir + "/credentials"}};
        if (!c.profile.empty()) variables["AWS_PROFILE"] = c.profile;
        Lookup lookup = ProfileCredentials(Env(variables), client, sources).Fetch();
        EXPECT_EQ(lookup.outcome, c.outcome) << lookup.why;
        if (c.outcome == Lookup::Outcome::kFound) {
            EXPECT_EQ(lookup.credentials.accessKey, c.accessKey);
        } else {
            EXPECT_NE(lookup.why.find(c.accessKey), std::string::npos) << lookup.why;
        }
        const auto requests = sts.Requests();
        std::vector<std::string> assumed;
        for (size_t i = seen; i < requests.size(); ++i)
            assumed.push_back(FormValue(requests[i].body, "RoleArn"));
        seen = requests.size();
        EXPECT_EQ(assumed, c.assumed);
    }
    const auto requests = sts.Requests();
    // The role of "role" was assumed with the user's keys, its session name and external id.
    EXPECT_NE(requests[0].Header("Authorization").find("Credential=AKIAUSER/"), std::string::npos);
    EXPECT_EQ(FormValue(requests[0].body, "RoleSessionName"), "cam-7");
    EXPECT_EQ(FormValue(requests[0].body, "ExternalId"), "ext");
    // The outer role of "chained" with the inner role's temporary credentials.
    EXPECT_EQ(requests[2].Header("X-Amz-Security-Token"), "t-AssumeRole");

    // No files at all, no profile asked for: absent, the chain goes on.
    Variables none = {{"HOME", dir + "/nowhere"}};
    EXPECT_EQ(ProfileCredentials(Env(none), client, sources).Fetch().outcome,
              Lookup::Outcome::kAbsent);
}

TEST(WebIdentityCredentialsTest, ReadsTheTokenFileOnEveryFetch) {
    ScriptedHttpServer sts(StsAnswer);
    StsConfig stsConfig;
    stsConfig.endpoint = sts.Endpoint();
    StsClient client(stsConfig);
    const std::string tokenFile = Write(Scratch("web") + "/token", "eyJ.first");
    Variables variables = {{"AWS_WEB_IDENTITY_TOKEN_FILE", tokenFile},
                           {"AWS_ROLE_ARN", "arn:aws:iam::1:role/eks"},
                           {"AWS_ROLE_SESSION_NAME", "pod-1"}};
    WebIdentityCredentials web(Env(variables), client);
    ASSERT_EQ(web.Fetch().credentials.accessKey, "ASIA-AssumeRoleWithWebIdentity-eks");
    Write(tokenFile, "eyJ.rotated");
    ASSERT_TRUE(web.Fetch().Ok());
    const auto requests = sts.Requests();
    ASSERT_EQ(requests.size(), 2u);
    EXPECT_EQ(FormValue(requests[0].body, "WebIdentityToken"), "eyJ.first");
    EXPECT_EQ(FormValue(requests[1].body, "WebIdentityToken"), "eyJ.rotated");
    EXPECT_EQ(FormValue(requests[1].body, "RoleSessionName"), "pod-1");

    EXPECT_EQ(WebIdentityCredentials(Env({}), client).Fetch().outcome, Lookup::Outcome::kAbsent);
    variables.erase("AWS_ROLE_ARN");
    EXPECT_EQ(WebIdentityCredentials(Env(variables), client).Fetch().outcome,
              Lookup::Outcome::kFailed);
}

// AWS_CA_BUNDLE: a server whose certificate only the bundle vouches for is trusted with the
// bundle and refused without it, by the credential sources' client and by the S3 store.
TEST(CaBundleTest, TrustsTheServersTheBundleVouchesFor) {
    const std::string dir = Scratch("ca");
    ASSERT_EQ(testsupport::RunProcess({"openssl", "req", "-x509", "-newkey", "rsa:2048", "-nodes",
                                       "-keyout", dir + "/key.pem", "-out", dir + "/cert.pem",
                                       "-days", "1", "-subj", "/CN=127.0.0.1", "-addext",
                                       "subjectAltName=IP:127.0.0.1"})
                  .exitStatus,
              0);
    testsupport::ChildProcess server({"openssl", "s_server", "-accept", "127.0.0.1:0", "-cert",
                                      dir + "/cert.pem", "-key", dir + "/key.pem", "-www"},
                                     dir + "/server.txt");
    std::string port;
    ASSERT_TRUE(testsupport::WaitUntil([&] {
        const std::string text = testsupport::ReadFile(dir + "/server.txt");
        const size_t at = text.find("ACCEPT 127.0.0.1:");
        if (at == std::string::npos || text.find('\n', at) == std::string::npos) return false;
        port = text.substr(at + 17, text.find('\n', at) - at - 17);
        return true;
    }));
    const std::string url = "https://127.0.0.1:" + port;
    for (const std::string& bundle : {dir + "/cert.pem", std::string()}) {
        SCOPED_TRACE(bundle);
        HttpRequest request;
        request.url = url + "/";
        request.caBundle = bundle;
        HttpResponse response;
        std::string why;
        EXPECT_EQ(Send(request, response, why), !bundle.empty()) << why;
        EXPECT_EQ(why.find("certificate") != std::string::npos, bundle.empty()) << why;

        // The store's PUT: s_server answers none, but only without the bundle is the
        // certificate the problem.
        LogCapture capture;
        S3StoreConfig config;
        ASSERT_TRUE(S3StoreConfig::Parse(url, config, why));
        config.caBundle = bundle;
        config.retry.attempts = 1;
        config.lowSpeedTimeS = 1;  // s_server may never answer the PUT
        const std::string body = "abc";
        ObjectToStore object;
        object.bucket = "rec";
        object.key = "k.ts";
        object.data = reinterpret_cast<const uint8_t*>(body.data());
        object.size = body.size();
        FileTransferInfo info;
        S3Store(config).Put(object, {"ak", "sk", "tok", "us-east-1", false}, &info);
        size_t certificateLines = 0;
        for (const auto& message : capture.Messages())
            certificateLines += message.find("certificate") != std::string::npos;
        EXPECT_EQ(certificateLines > 0, bundle.empty());
    }
}
