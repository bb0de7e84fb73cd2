// The credential sources against stand-ins on 127.0.0.1 that answer as the real services do.
// Faults guarded: the container token sent to a URL it must not travel to, or a stale token
// (the file is read on every fetch and wins over the variable); the IMDSv2 exchange broken, or
// an absent or stalled metadata service that does not fall through within seconds; profiles
// resolved unlike the AWS CLI (file precedence, role chains and loops, credential_process,
// credential_source, web identity, what is unsupported); a rotated web identity token not read
// again; AWS_CA_BUNDLE not trusted, or trust without it, by the sources' client and the S3 store.
#include <gtest/gtest.h>

#include <atomic>

#include "platform/awsauth/ContainerCredentials.h"
#include "platform/awsauth/HttpClient.h"
#include "platform/awsauth/InstanceMetadata.h"
#include "platform/awsauth/ProfileCredentials.h"
#include "platform/awsauth/WebIdentityCredentials.h"
#include "platform/transfer/S3Store.h"
#include "tests/support/AwsStandIns.h"
#include "tests/support/LogCapture.h"
#include "tests/support/TestSupport.h"

using namespace awsauth;
using namespace testsupport;
using Variables = std::map<std::string, std::string>;

namespace {

const auto kLater = std::chrono::system_clock::now() + std::chrono::hours(1);

// STS stand-in: every action answers with credentials named after it and the role asked for.
std::string StsAnswer(const HttpRequestSeen& request) {
    const std::string action = FormValue(request.body, "Action");
    std::string arn = FormValue(request.body, "RoleArn");
    return StsCredentialsAnswer(action, "ASIA-" + action + "-" + arn.substr(arn.rfind('/') + 1),
                                "s-" + action, "t-" + action, kLater);
}

StsClient Sts(const ScriptedHttpServer& server) {
    StsConfig config;
    config.region = "eu-west-1";
    config.endpoint = server.Endpoint();
    return StsClient(config);
}

}  // namespace

TEST(ContainerCredentialsTest, ChoosesOnlyUrlsTheTokenMayTravelTo) {
    const std::string full = "AWS_CONTAINER_CREDENTIALS_FULL_URI";
    const struct {
        Variables variables;
        std::string url;  // "" when refused
    } cases[] = {
        {{{"AWS_CONTAINER_CREDENTIALS_RELATIVE_URI", "/v2/x"}, {full, "http://127.0.0.1:1/y"}},
         "http://169.254.170.2/v2/x"},
        {{{full, "http://169.254.170.23/v1/c"}}, "http://169.254.170.23/v1/c"},
        {{{full, "http://[fd00:ec2::23]/c"}}, "http://[fd00:ec2::23]/c"},
        {{{full, "https://creds.example.com/c"}}, "https://creds.example.com/c"},
        {{{full, "http://creds.example.com/c"}}, ""},
        {{{full, "http://10.0.0.1/c"}}, ""},
        {{{full, "http://127.0.0.1@evil.example/c"}}, ""},
        {{{full, "file:///etc/passwd"}}, ""},
    };
    for (const auto& c : cases) {
        std::string why;
        EXPECT_EQ(ContainerCredentials(EnvOf(c.variables)).Url(why), c.url) << why;
        EXPECT_EQ(why.empty(), !c.url.empty());
    }
    EXPECT_EQ(ContainerCredentials(EnvOf({})).Fetch().outcome, Lookup::Outcome::kAbsent);
}

TEST(ContainerCredentialsTest, AsksWithTheAuthorizationTokenOfTheMoment) {
    ScriptedHttpServer agent([](const HttpRequestSeen& request) {
        const std::string token = request.Header("Authorization");
        if (token.rfind("token-", 0) != 0) return HttpAnswer("401 Unauthorized", "");
        return HttpAnswer("200 OK", "", CredentialsJson("ASIACONTAINER", "c", token, kLater));
    });
    const std::string tokenFile = WriteFile(ScratchDir("container") + "/token", "token-1\n");
    Variables variables = {{"AWS_CONTAINER_CREDENTIALS_FULL_URI", agent.Endpoint() + "/v1/creds"},
                           {"AWS_CONTAINER_AUTHORIZATION_TOKEN", "token-env"},
                           {"AWS_CONTAINER_AUTHORIZATION_TOKEN_FILE", tokenFile}};
    ContainerCredentials container(EnvOf(variables));
    Lookup first = container.Fetch();
    ASSERT_TRUE(first.Ok()) << first.why;
    EXPECT_EQ(first.credentials.accessKey, "ASIACONTAINER");
    EXPECT_EQ(first.credentials.sessionToken, "token-1");  // the file wins over the variable
    EXPECT_TRUE(first.credentials.expiration.has_value());
    WriteFile(tokenFile, "token-2");  // the agent rotated it
    EXPECT_EQ(container.Fetch().credentials.sessionToken, "token-2");
    EXPECT_EQ(agent.Requests().back().target, "/v1/creds");

    variables.erase("AWS_CONTAINER_AUTHORIZATION_TOKEN_FILE");
    EXPECT_EQ(ContainerCredentials(EnvOf(variables)).Fetch().credentials.sessionToken, "token-env");
    variables["AWS_CONTAINER_AUTHORIZATION_TOKEN"] = "wrong";
    Lookup refused = ContainerCredentials(EnvOf(variables)).Fetch();
    EXPECT_EQ(refused.outcome, Lookup::Outcome::kFailed);
    EXPECT_NE(refused.why.find("HTTP 401"), std::string::npos) << refused.why;
}

// The documented IMDSv2 exchange: a session token first, then the role, then its credentials,
// each later request carrying the token. Off EC2 (nothing answers, or something accepts and
// never answers) the source is absent within about its 1 s bound.
TEST(InstanceMetadataTest, FetchesWithASessionTokenAndFallsThroughQuicklyWhenAbsent) {
    std::atomic<bool> roleAttached{true};  // read on the server thread
    const std::string roles = "/latest/meta-data/iam/security-credentials/";
    ScriptedHttpServer imds([&](const HttpRequestSeen& request) {
        if (request.method == "PUT" && request.target == "/latest/api/token")
            return request.Header("X-aws-ec2-metadata-token-ttl-seconds") == "21600"
                       ? HttpAnswer("200 OK", "", "IMDS-TOKEN")
                       : HttpAnswer("400 Bad Request", "");
        if (request.Header("X-aws-ec2-metadata-token") != "IMDS-TOKEN")
            return HttpAnswer("401 Unauthorized", "");
        if (request.target == roles && roleAttached) return HttpAnswer("200 OK", "", "rec-role");
        if (request.target == roles + "rec-role")
            return HttpAnswer("200 OK", "", CredentialsJson("ASIAIMDS", "i", "i-token", kLater));
        return HttpAnswer("404 Not Found", "");
    });
    InstanceMetadata metadata(
        EnvOf({{"AWS_EC2_METADATA_SERVICE_ENDPOINT", imds.Endpoint() + "/"}}));
    Lookup found = metadata.Fetch();
    ASSERT_TRUE(found.Ok()) << found.why;
    EXPECT_EQ(found.credentials.accessKey, "ASIAIMDS");
    EXPECT_EQ(found.credentials.sessionToken, "i-token");
    EXPECT_EQ(imds.Requests().size(), 3u);
    roleAttached = false;
    EXPECT_EQ(metadata.Fetch().outcome, Lookup::Outcome::kAbsent);
    const size_t asked = imds.Requests().size();
    EXPECT_EQ(InstanceMetadata(EnvOf({{"AWS_EC2_METADATA_SERVICE_ENDPOINT", imds.Endpoint()},
                                      {"AWS_EC2_METADATA_DISABLED", "TRUE"}}))
                  .Fetch()
                  .outcome,
              Lookup::Outcome::kAbsent);
    EXPECT_EQ(imds.Requests().size(), asked);  // turned off: not asked at all
    EXPECT_EQ(
        InstanceMetadata(EnvOf({{"AWS_EC2_METADATA_SERVICE_ENDPOINT_MODE", "IPv6"}})).Endpoint(),
        "http://[fd00:ec2::254]");

    // Something that accepts and never answers, then nothing at all.
    auto stall = std::make_unique<ScriptedHttpServer>(ScriptedHttpServer::Mode::kStall);
    const std::string endpoint = stall->Endpoint();
    for (int round = 0; round < 2; ++round, stall.reset()) {
        const auto started = std::chrono::steady_clock::now();
        Lookup lookup =
            InstanceMetadata(EnvOf({{"AWS_EC2_METADATA_SERVICE_ENDPOINT", endpoint}})).Fetch();
        EXPECT_EQ(lookup.outcome, Lookup::Outcome::kAbsent) << lookup.why;
        EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(5));
    }
}

TEST(ProfileCredentialsTest, ResolvesProfilesAsTheAwsCliDoes) {
    ScriptedHttpServer sts(StsAnswer);
    StsClient client = Sts(sts);
    const std::string dir = ScratchDir("profiles");
    WriteFile(dir + "/web-token", "eyJ.web.token");
    WriteFile(dir + "/config",
              "# comment\n[default]\nregion = eu-west-1\n"
              "[profile role]\nrole_arn = arn:aws:iam::1:role/rec\nsource_profile = user\n"
              "role_session_name = cam-7\nexternal_id = ext\n"
              "[profile chained]\nrole_arn = arn:aws:iam::1:role/outer\nsource_profile = role\n"
              "[profile self]\nrole_arn = arn:aws:iam::1:role/self\nsource_profile = self\n"
              "aws_access_key_id = AKIASELF\naws_secret_access_key = self-secret\n"
              "[profile loop-a]\nrole_arn = arn:aws:iam::1:role/a\nsource_profile = loop-b\n"
              "[profile loop-b]\nrole_arn = arn:aws:iam::1:role/b\nsource_profile = loop-a\n"
              "[profile proc]\ncredential_process = fetch-creds --fast\n"
              "[profile env-role]\nrole_arn = arn:aws:iam::1:role/env\n"
              "credential_source = Environment\n"
              "[profile web]\nrole_arn = arn:aws:iam::1:role/web\nweb_identity_token_file = " +
                  dir +
                  "/web-token\n"
                  "[profile mfa]\nrole_arn = arn:aws:iam::1:role/m\nsource_profile = user\n"
                  "mfa_serial = arn:aws:iam::1:mfa/u\n"
                  "[profile sso]\nsso_session = corp\nsso_account_id = 1\n"
                  "[profile half]\naws_access_key_id = AKIAHALF\n"
                  "[profile user]\naws_access_key_id = AKIA-FROM-CONFIG\n"
                  "s3 =\n  aws_access_key_id = AKIA-NESTED\n");
    WriteFile(dir + "/credentials",
              "[default]\naws_access_key_id = AKIADEFAULT\naws_secret_access_key = d-secret\n"
              "[user]\n; the credentials file wins over the config file\n"
              "aws_access_key_id=AKIAUSER\naws_secret_access_key = u-secret \n");
    ProfileSources sources;
    sources.process = [](const std::string& command) {
        return command == "fetch-creds --fast"
                   ? Lookup::Found({"ASIAPROC", "p-secret", "p-token", kLater})
                   : Lookup::Failed("unknown command");
    };
    sources.environment = [] { return Lookup::Found({"AKIAENV", "e-secret", "", std::nullopt}); };

    const auto kFound = Lookup::Outcome::kFound, kFailed = Lookup::Outcome::kFailed;
    const std::string arn = "arn:aws:iam::1:role/";
    const struct {
        std::string profile;  // "" for AWS_PROFILE unset
        Lookup::Outcome outcome;
        std::string accessKey;             // when found; else a part of the reason
        std::vector<std::string> assumed;  // RoleArn of each STS request, in order
    } cases[] = {
        {"", kFound, "AKIADEFAULT", {}},
        {"user", kFound, "AKIAUSER", {}},
        {"role", kFound, "ASIA-AssumeRole-rec", {arn + "rec"}},
        {"chained", kFound, "ASIA-AssumeRole-outer", {arn + "rec", arn + "outer"}},
        {"self", kFound, "ASIA-AssumeRole-self", {arn + "self"}},
        {"proc", kFound, "ASIAPROC", {}},
        {"env-role", kFound, "ASIA-AssumeRole-env", {arn + "env"}},
        {"web", kFound, "ASIA-AssumeRoleWithWebIdentity-web", {arn + "web"}},
        {"loop-a", kFailed, "loops", {}},
        {"mfa", kFailed, "mfa_serial", {}},
        {"sso", kFailed, "export-credentials", {}},
        {"half", kFailed, "both aws_access_key_id", {}},
        {"nobody", kFailed, "no profile nobody", {}},
    };
    size_t seen = 0;
    for (const auto& c : cases) {
        SCOPED_TRACE(c.profile);
        Variables variables = {{"AWS_CONFIG_FILE", dir + "/config"},
                               {"AWS_SHARED_CREDENTIALS_FILE", dir + "/credentials"}};
        if (!c.profile.empty()) variables["AWS_PROFILE"] = c.profile;
        Lookup lookup = ProfileCredentials(EnvOf(variables), client, sources).Fetch();
        EXPECT_EQ(lookup.outcome, c.outcome) << lookup.why;
        EXPECT_NE(
            (c.outcome == kFound ? lookup.credentials.accessKey : lookup.why).find(c.accessKey),
            std::string::npos)
            << lookup.why;
        const auto requests = sts.Requests();
        std::vector<std::string> assumed;
        for (; seen < requests.size(); ++seen)
            assumed.push_back(FormValue(requests[seen].body, "RoleArn"));
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
    EXPECT_EQ(
        ProfileCredentials(EnvOf({{"HOME", dir + "/nowhere"}}), client, sources).Fetch().outcome,
        Lookup::Outcome::kAbsent);
}

TEST(WebIdentityCredentialsTest, ReadsTheTokenFileOnEveryFetch) {
    ScriptedHttpServer sts(StsAnswer);
    StsClient client = Sts(sts);
    const std::string tokenFile = WriteFile(ScratchDir("web") + "/token", "eyJ.first");
    Variables variables = {{"AWS_WEB_IDENTITY_TOKEN_FILE", tokenFile},
                           {"AWS_ROLE_ARN", "arn:aws:iam::1:role/eks"},
                           {"AWS_ROLE_SESSION_NAME", "pod-1"}};
    WebIdentityCredentials web(EnvOf(variables), client);
    ASSERT_EQ(web.Fetch().credentials.accessKey, "ASIA-AssumeRoleWithWebIdentity-eks");
    WriteFile(tokenFile, "eyJ.rotated");
    ASSERT_TRUE(web.Fetch().Ok());
    const auto requests = sts.Requests();
    ASSERT_EQ(requests.size(), 2u);
    EXPECT_EQ(FormValue(requests[0].body, "WebIdentityToken"), "eyJ.first");
    EXPECT_EQ(FormValue(requests[1].body, "WebIdentityToken"), "eyJ.rotated");
    EXPECT_EQ(FormValue(requests[1].body, "RoleSessionName"), "pod-1");
    EXPECT_EQ(WebIdentityCredentials(EnvOf({}), client).Fetch().outcome, Lookup::Outcome::kAbsent);
    variables.erase("AWS_ROLE_ARN");
    EXPECT_EQ(WebIdentityCredentials(EnvOf(variables), client).Fetch().outcome,
              Lookup::Outcome::kFailed);
}

// A server only the bundle vouches for: trusted with it, refused without, by the sources' client
// and by the S3 store.
TEST(CaBundleTest, TrustsTheServersTheBundleVouchesFor) {
    const std::string dir = ScratchDir("ca");
    const std::string pair = " " + dir + "/key.pem ", cert = " " + dir + "/cert.pem ";
    ASSERT_EQ(RunProcess(Words("openssl req -x509 -newkey rsa:2048 -nodes -days 1 -keyout" + pair +
                               "-out" + cert +
                               "-subj /CN=127.0.0.1 -addext "
                               "subjectAltName=IP:127.0.0.1"))
                  .exitStatus,
              0);
    ChildProcess server(
        Words("openssl s_server -accept 127.0.0.1:0 -www -cert" + cert + "-key" + pair),
        dir + "/server.txt");
    std::string port;
    ASSERT_TRUE(WaitUntil([&] {
        const std::string text = ReadFile(dir + "/server.txt");
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
        // The store's PUT: s_server may answer none, but only without the bundle is the
        // certificate the problem.
        LogCapture capture;
        S3StoreConfig config;
        ASSERT_TRUE(S3StoreConfig::Parse(url, config, why));
        config.caBundle = bundle;
        config.retry.attempts = config.lowSpeedTimeS = 1;
        FileTransferInfo info;
        S3Store(config).Put(ObjectFor("rec", "k.ts", "abc"), {"ak", "sk", "t", "us-east-1", false},
                            &info);
        EXPECT_EQ(capture.CountContaining("certificate") > 0, bundle.empty());
    }
}
