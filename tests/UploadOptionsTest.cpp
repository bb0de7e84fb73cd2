// UploadOptions: which values each upload option takes, and the headers they become. Faults
// guarded: a value S3 would refuse accepted (at the first PUT instead of at start), a valid one
// refused, a header misspelt or a tag value not encoded, a KMS key without aws:kms.
#include <gtest/gtest.h>

#include "platform/framework/FrameworkOptions.h"
#include "tests/support/TestSupport.h"

namespace {

using Headers = std::vector<std::pair<std::string, std::string>>;

UploadOptions Read(std::vector<std::string> args, std::vector<std::string>& errors) {
    args.insert(args.begin(), "stream-file-recorder");
    std::vector<char*> argv;
    for (auto& arg : args) argv.push_back(arg.data());
    return UploadOptions::Read(CommandLine(static_cast<int>(argv.size()), argv.data()), errors);
}

}  // namespace

TEST(UploadOptionsTest, AcceptedValuesBecomeHeadersOthersEndTheStart) {
    std::string elevenTags = "t0=v";
    for (int i = 1; i <= 10; ++i) elevenTags += "&t" + std::to_string(i) + "=v";
    const struct {
        std::vector<std::string> args;
        Headers headers;    // when accepted
        std::string error;  // a part of the one error; "" when accepted
    } cases[] = {
        {{"-sse", "AES256"}, {{"x-amz-server-side-encryption", "AES256"}}, ""},
        {{"-sse", "aws:kms", "-ssekmskeyid", "alias/recordings"},
         {{"x-amz-server-side-encryption", "aws:kms"},
          {"x-amz-server-side-encryption-aws-kms-key-id", "alias/recordings"}},
         ""},
        {{"-sse", "aes256"}, {}, "-sse is AES256 or aws:kms"},
        {{"-ssekmskeyid", "alias/recordings"}, {}, "-ssekmskeyid needs -sse aws:kms"},
        {{"-storageclass", "STANDARD_IA", "-acl", "bucket-owner-full-control"},
         {{"x-amz-storage-class", "STANDARD_IA"}, {"x-amz-acl", "bucket-owner-full-control"}},
         ""},
        {{"-storageclass", "cold"}, {}, "-storageclass is one of STANDARD,"},
        {{"-acl", "public"}, {}, "-acl is one of private,"},
        {{"-tagging", "project=cams&site=north 1&empty="},
         {{"x-amz-tagging", "project=cams&site=north%201&empty="}},
         ""},
        {{"-tagging", "a=1&=2"}, {}, "each tag is key=value"},
        {{"-tagging", "a=1&a=2"}, {}, "given twice"},
        {{"-tagging", elevenTags}, {}, "at most 10 tags"},
        {{"-addressing", "virtual"}, {}, ""},
        {{"-addressing", "host"}, {}, "-addressing is path, virtual or auto"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(testing::PrintToString(c.args));
        std::vector<std::string> errors;
        UploadOptions options = Read(c.args, errors);
        if (c.error.empty()) {
            EXPECT_TRUE(errors.empty()) << errors[0];
            EXPECT_EQ(options.Headers(), c.headers);
        } else {
            ASSERT_EQ(errors.size(), 1u);
            EXPECT_NE(errors[0].find(c.error), std::string::npos) << errors[0];
            EXPECT_TRUE(options.Headers().empty());
        }
    }
}
