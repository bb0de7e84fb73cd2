// AwsInfo: temporary AWS credentials as the host delivers them; handed over by value.
#pragma once

#include <string>

namespace Orvane {

struct AwsInfo {
    std::string accessKey;     // "awsAccessKey"
    std::string secretKey;     // "awsSecretKey"
    std::string sessionToken;  // "sessionToken"
    std::string region;        // "region"
};

}  // namespace Orvane
