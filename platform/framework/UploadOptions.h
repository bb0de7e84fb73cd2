// UploadOptions: how each object is stored beyond its bytes, as the framework's options give it:
// server-side encryption, storage class, canned ACL, tags, the bucket addressing style and the
// CAs to trust. Read once with the other framework options; a plain value after that.
//
// Values are checked when read, so that a mistyped option ends the start with its own message
// rather than every upload with an S3 error.
#pragma once

#include <string>
#include <utility>
#include <vector>

class CommandLine;  // FrameworkOptions.h

struct UploadOptions {
    std::string sse;           // -sse: "" (the bucket's default), "AES256" or "aws:kms"
    std::string sseKmsKeyId;   // -ssekmskeyid: key id, ARN or alias with aws:kms; "" for the
                               // AWS managed key
    std::string storageClass;  // -storageclass: "" for STANDARD
    std::string acl;           // -acl: a canned ACL such as bucket-owner-full-control; "" none
    std::string tagging;       // -tagging: "key=value&key2=value2", unencoded; "" for none
    std::string addressing = "auto";  // -addressing: "path", "virtual" or "auto" (virtual-hosted
                                      // for AWS, path-style for another endpoint)
    std::string caBundle;             // AWS_CA_BUNDLE: PEM file of the CAs to trust; "" system's

    // Reads the options and AWS_CA_BUNDLE; a value that cannot be used is reported in
    // `errors` and left at its default.
    static UploadOptions Read(const CommandLine& commandLine, std::vector<std::string>& errors);

    // The request headers that carry the options on each PUT (x-amz-server-side-encryption,
    // x-amz-server-side-encryption-aws-kms-key-id, x-amz-storage-class, x-amz-acl and
    // x-amz-tagging, the tags percent-encoded as a query string), in that order.
    std::vector<std::pair<std::string, std::string>> Headers() const;
};
